# Device status: a charging period with battery levels, a headset, Wi-Fi and a Bluetooth bond.
features() {
  sqlite3 "$SYSROOT/opt/usr/dbspace/.SurveyLog.db" \
    "SELECT feature, extra, value FROM use_app_feature_survey WHERE feature IN ($1) ORDER BY _id" \
    2>/dev/null || true
}
# has_rows CODES N: at least N rows of those feature codes.
has_rows() { [ "$(features "$1" | grep -c .)" -ge "$2" ]; }
show() { features "$1" | while read -r row; do info "$row  (feature|extra|value)"; done; }

step "The charger is plugged in over USB at 40 %, and unplugged a second later at 41 %"
devsim charger plug usb 40
wait_until "has_rows \"'BAT1'\" 1"
sleep 1
devsim charger unplug 41
wait_until "has_rows \"'BAT2'\" 1"
show "'BAT1','CHAR','BAT2'"

step "A headset is plugged in and out; Wi-Fi connects and goes off"
devsim earjack in
devsim wifi on
sleep 1
devsim earjack out
devsim wifi off
wait_until "has_rows \"'HEAD','WIFI'\" 2"
show "'HEAD','WIFI'"

step "A Bluetooth headset (class 0x240404: major 4, minor 1) pairs and is removed"
if devsim bt pair 00:11:22:33:44:55 0x240404 2>/dev/null; then
  sleep 1
  devsim bt unpair 00:11:22:33:44:55
  wait_until "has_rows \"'BLUE'\" 1"
  show "'BLUE'"
else
  info "no BlueZ service on the bus: run the demo with DEMO_MOCKS=\"--mock bluez5\""
fi
