# The wearer lowers the wrist: the screen goes off, then on again and is unlocked.
scrn_rows() { db .SurveyLog.db "SELECT count(*) FROM use_app_feature_survey WHERE feature='SCRN'"; }
step "The screen goes off for a while, then on; the wearer unlocks"
before="$(scrn_rows)"
devsim screen off
sleep 1.5
devsim screen on
devsim unlock
wait_until '[ "$(scrn_rows)" -gt "$before" ]'
db .SurveyLog.db "SELECT feature, value FROM use_app_feature_survey WHERE feature IN ('SCRN','UNLO') ORDER BY _id DESC LIMIT 2" |
  while read -r row; do info "$row  (feature|milliseconds or count)"; done
