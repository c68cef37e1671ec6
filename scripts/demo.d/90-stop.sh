# Consent withdrawn: the daemon stops cleanly.
step "The user withdraws consent; logmgrd shuts down"
vconftool set -t bool db/setting/report_diagnostic_info 0
status=0
wait "$DAEMON_PID" || status=$?
info "logmgrd exited with status $status"
if [ -z "$(name_owner)" ]; then info "com.corvane.logmgr has no owner any more"; fi
DAEMON_PID=""
