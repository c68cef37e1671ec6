# Consent given: the daemon starts and owns its bus name.
step "The user consents to diagnostic reporting; logmgrd starts"
vconftool set -t bool db/setting/report_diagnostic_info 1
start_daemon
info "com.corvane.logmgr is owned by $(name_owner) (logmgrd pid $DAEMON_PID)"
