# App usage: two apps take turns in front, the lock screen ends a period, one app dies.
app_rows() {
  sqlite3 "$SYSROOT/opt/usr/dbspace/.SurveyLog.db" "SELECT count(*) FROM use_app_survey" 2>/dev/null || echo 0
}
show_apps() {
  if logmgrctl show use_app_survey >/dev/null 2>&1; then
    logmgrctl show use_app_survey | while read -r row; do info "$row"; done
  else
    sqlite3 "$SYSROOT/opt/usr/dbspace/.SurveyLog.db" \
      "SELECT app_id, duration FROM use_app_survey ORDER BY _id" | while read -r row; do
      info "$row  (package|milliseconds)"; done
  fi
}

if [ -z "${DISPLAY:-}" ]; then
  step "App usage needs X; skipped (no DISPLAY)"
else
  step "Three apps are installed and launched: a clock, a music player and the lock screen"
  devsim app install com.example.clock --package com.example.clock >/dev/null
  devsim app install com.example.music --package com.example.music >/dev/null
  devsim app install com.corvane.lockscreen >/dev/null
  for app in com.example.clock com.example.music com.corvane.lockscreen; do
    info "$app runs as pid $(devsim app launch "$app")"
  done

  step "The clock is in front for 2 s, then the music player; the clock dies 1 s later (real seconds; the device clock runs faster)"
  devsim app focus com.example.clock >/dev/null
  sleep 2
  devsim app focus com.example.music >/dev/null
  sleep 1
  devsim app kill com.example.clock >/dev/null
  info "a tracked app that dies counts the time since the running period began, in front or not"

  step "The lock screen comes up: it ends the music player's period and starts none"
  devsim app focus com.corvane.lockscreen >/dev/null
  wait_until '[ "$(app_rows)" -ge 3 ]'
  devsim app kill com.example.music >/dev/null
  devsim app kill com.corvane.lockscreen >/dev/null
  show_apps
fi
