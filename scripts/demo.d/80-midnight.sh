# Midnight passes; the two-hourly alarm finds the day finished and the report run hands the
# day's records to the relay.
step "The evening ends; waiting for midnight and the next alarm"
OUTBOX="$SYSROOT/opt/usr/data/log-relay/outbox.jsonl"
summary_sent() { [ -f "$OUTBOX" ] && grep -Eq '"4": ?"007"' "$OUTBOX"; }
last=""
until summary_sent; do
  sleep 0.5
  now="$(device_time)"
  if [ "${now%?}" != "$last" ]; then info "device clock $now"; last="${now%?}"; fi
  if ! kill -0 "$DAEMON_PID" 2>/dev/null; then echo "demo: logmgrd ended early" >&2; exit 1; fi
  if [ "$(date +%s)" -gt "$(echo "$DEMO_T0 + 7200 * 1.2 / $DEMO_SPEED" | bc | cut -d. -f1)" ]; then
    echo "demo: no report reached the relay" >&2; exit 1
  fi
done
step "The report run handed the day to the relay (logmgrctl outbox shows every field):"
/usr/bin/python3 - "$OUTBOX" <<'PY'
import json, sys
kinds = {"001": "app use", "002": "device feature", "003": "package", "004": "crash",
         "007": "day summary"}
header = ("mcc", "mnc", "did", "model", "fw_ver")
records = [json.loads(l) for l in open(sys.argv[1]) if l.strip()]
for n, r in enumerate(records, 1):
    pairs = [p.split("=", 1) for p in r["7"].split("¶")]
    if n == 1:
        h = dict(p for p in pairs if p[0] in header)
        print(f"   from {h.get('model')} (build {h.get('fw_ver')}, SIM {h.get('mcc')}/{h.get('mnc')}),"
              f" {len(records)} records, svc {r['2']}, type {r['1']}, app {r['8']}")
    body = "  ".join(f"{k}={v}" for k, v in pairs if k not in header)
    print(f"   #{n:<3} {r['4']} {kinds.get(r['4'], '?'):<15} {body}")
PY
step "The upload queue is empty again"
info "survey_log: $(db .ServerUploaderDB.db "SELECT count(*) FROM survey_log") records queued"
step "Rows left in the collection tables (the finished day was condensed and removed)"
for t in use_app_survey use_app_feature_survey report_app_status_survey report_app_error_survey manage_app_survey; do
  info "$(printf '%-26s %s' "$t" "$(db .SurveyLog.db "SELECT count(*) FROM $t")")"
done
info "$(printf '%-26s %s' "records in the outbox" "$(grep -c . "$OUTBOX")")"
step "Where the files are"
info "databases:   $SYSROOT/opt/usr/dbspace/ ($(cd "$SYSROOT/opt/usr/dbspace" && ls -A | tr '\n' ' '))"
info "relay:       $OUTBOX"
info "vconf keys:  $SYSROOT/opt/var/kdb and $SYSROOT/var/run/memory"
info "daemon out:  $SYSROOT/logmgrd.out"
