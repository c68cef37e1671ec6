# Consent withdrawn: the daemon stops cleanly.
step "The user withdraws consent; logmgrd shuts down"
# A withdrawal before the deferred start has finished is ignored, so repeat it until the
# daemon is gone (every set of the key notifies).
for _ in $(seq 100); do
  vconftool set -t bool db/setting/report_diagnostic_info 0
  kill -0 "$DAEMON_PID" 2>/dev/null || break
  sleep 0.1
done
status=0
wait "$DAEMON_PID" || status=$?
info "logmgrd exited with status $status"
if [ -z "$(name_owner)" ]; then info "com.corvane.logmgr has no owner any more"; fi
DAEMON_PID=""
