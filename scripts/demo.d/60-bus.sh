# An outside process writes to and reads from the two shared tables over the bus.
step "Another process records app status over the bus (logmgrctl insert, twice for one pair)"
info "row id $(logmgrctl insert report_app_status_survey app_id=com.example.music feature=PLAY value=1)"
info "row id $(logmgrctl insert report_app_status_survey app_id=com.example.music feature=PLAY value=7)  (same pair: updated)"
info "row id $(logmgrctl insert use_app_feature_survey app_id=com.example.music feature=LIKE extra=demo value=3)"

step "It reads the rows back through shared memory (logmgrctl select)"
logmgrctl select report_app_status_survey app_id,feature,value | while read -r row; do info "$row"; done
logmgrctl select use_app_feature_survey app_id,feature,extra,value | tail -n 3 |
  while read -r row; do info "$row"; done

step "Attempts to reach other tables are refused and change nothing"
{ logmgrctl delete use_app_feature_survey --where "0; DROP TABLE use_app_survey" 2>&1 || true; } |
  while read -r line; do info "$line"; done
{ logmgrctl insert use_app_feature_survey "app_id=x'); --" feature=F 2>&1 || true; } |
  while read -r line; do info "$line"; done
info "use_app_survey still there: $(logmgrctl show use_app_survey --limit 0 | head -n 1)"
