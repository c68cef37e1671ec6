# The finished day once more: its rows are condensed now, so the page shows what the relay got.
REPORTED_PAGE="$SYSROOT/day-$DEMO_DAY-reported.html"
step "The reported day, as a page: the records the relay got, the queue, what is still open"
logmgrctl day "$DEMO_DAY" --html "$REPORTED_PAGE"
DAY_PAGES="${DAY_PAGES:-} $REPORTED_PAGE"
