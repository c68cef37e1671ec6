# The evening so far as one page: what was in front, the device's periods and events.
DEMO_DAY="${DEMO_START%% *}"
EVENING_PAGE="$SYSROOT/day-$DEMO_DAY-evening.html"
step "The evening so far, as a page (logmgrctl day $DEMO_DAY --html ...)"
logmgrctl day "$DEMO_DAY" --html "$EVENING_PAGE"
logmgrctl day "$DEMO_DAY" | sed -n '/^Foreground time per app/,/^$/p' | sed '/^$/d' |
  while IFS= read -r line; do info "$line"; done
DAY_PAGES="$EVENING_PAGE"
