# Packages and crashes: an install, an update that fails and then succeeds, a crash.
survey() { sqlite3 -cmd ".timeout 5000" "$SYSROOT/opt/usr/dbspace/.SurveyLog.db" "$1" 2>/dev/null || true; }
pkg_rows() { survey "SELECT count(*) FROM manage_app_survey"; }
show_table() {
  local table="$1" columns="$2" legend="$3"
  if logmgrctl show "$table" >/dev/null 2>&1; then
    logmgrctl show "$table" | while read -r row; do info "$row"; done
  else
    survey "SELECT $columns FROM $table ORDER BY _id" | while read -r row; do
      info "$row  ($legend)"; done
  fi
}

step "A watch face is installed; an update of it fails, then the package manager finishes it"
devsim pkg install com.example.watchface
devsim pkg update com.example.watchface --fail
info "the failed update leaves its kind pending: nothing recorded yet"
# The package manager completes the pending update without announcing a new start. It stays on
# the bus until logmgrd has handled the event (a ping answered after it): the receiver asks the
# bus who sent it, and a sender already gone counts as nobody.
/usr/bin/python3 - <<'EOF'
import dbus, dbus.lowlevel
bus = dbus.SystemBus()
msg = dbus.lowlevel.SignalMessage("/org/tizen/pkgmgr_status", "org.tizen.pkgmgr_status", "status")
msg.append("retry", "tpk", "com.example.watchface", "end", "ok", signature="sssss")
bus.send_message(msg)
bus.call_blocking("com.corvane.logmgr", "/", "org.freedesktop.DBus.Peer", "Ping", "", ())
EOF
wait_until '[ "$(pkg_rows)" -ge 2 ]'
show_table manage_app_survey "installed_app_id, type" "package|0 install, 1 uninstall, 2 update"

step "The watch face crashes"
devsim crash com.example.watchface
wait_until '[ "$(survey "SELECT count(*) FROM report_app_error_survey")" -ge 1 ]'
show_table report_app_error_survey "app_id, type" "app|1 crash"
