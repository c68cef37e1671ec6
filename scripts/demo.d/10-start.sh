# Consent given: the daemon starts on the device clock and owns its bus name.
step "The user consents to diagnostic reporting; logmgrd starts (device clock from $DEMO_START, ${DEMO_SPEED}x)"
vconftool set -t bool db/setting/report_diagnostic_info 1
vconftool set -t int memory/pm/state 1
start_daemon
info "com.corvane.logmgr is owned by $(name_owner) (logmgrd pid $DAEMON_PID)"
# The deferred start has run once the tables exist.
wait_until '[ "$(db .SurveyLog.db "SELECT count(*) FROM sqlite_master WHERE type=\"table\" AND name LIKE \"%survey\"")" = 5 ]'
info "tables ready; yesterday is already reported, today is being recorded"
