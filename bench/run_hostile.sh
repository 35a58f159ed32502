#!/bin/sh
# Builds the Release preset "bench", starts a private session bus and the daemon with
# its directories in a temporary directory, runs hostile_load and prints its report,
# then the daemon's live status, its clean exit (SIGTERM), the rows in the store and
# the error lines of its log.
#
# Environment: REPETITIONS (3), SECONDS_PER_PHASE of pinging (10), HOSTILE connections
# (4), CLIENTS that vanish (12000), PARALLEL (8), MESSAGES into one session (150000),
# WINDOW (64), SESSIONS left idle (10000), PER_CLIENT sessions (50), SCENARIOS
# (ping,vanish,flood,idle,wait), JOBS build jobs (2), VIREO_BENCH_BUILD
# build directory (build/bench), VIREO_BENCH_NO_BUILD=1 to skip the build,
# VIREO_BENCH_KEEP=1 to keep the temporary directory (daemon log, store).
set -eu

TARGETS="hostile_load" TMP_PREFIX=vireo-hostile
. "$(dirname "$0")/private_daemon.sh"

status=0
"$BUILD/bench/hostile_load" --pid "$DAEMON_PID" --db "$STATE_DIRECTORY/vireo.db" \
  --repetitions "${REPETITIONS:-3}" --scenarios "${SCENARIOS:-ping,vanish,flood,idle,wait}" \
  --seconds "${SECONDS_PER_PHASE:-10}" --hostile "${HOSTILE:-4}" \
  --clients "${CLIENTS:-12000}" --parallel "${PARALLEL:-8}" \
  --messages "${MESSAGES:-150000}" --window "${WINDOW:-64}" \
  --sessions "${SESSIONS:-10000}" --per-client "${PER_CLIENT:-50}" || status=$?

echo "== the daemon after the run"
if kill -0 "$DAEMON_PID" 2>/dev/null; then
  "$CTL" status || true
  kill -TERM "$DAEMON_PID"
  daemon_status=0
  wait "$DAEMON_PID" || daemon_status=$?
  DAEMON_PID=
  echo "  SIGTERM: exit status $daemon_status (0 expected)"
  [ "$daemon_status" -eq 0 ] || status=1
else
  echo "  the daemon is gone"
  status=1
fi
if command -v sqlite3 >/dev/null; then
  echo "  rows in the store after the exit:"
  for table in telemetry_sessions telemetry_messages analytics_events energy_events; do
    printf '    %-20s %s\n' "$table" "$(sqlite3 "$STATE_DIRECTORY/vireo.db" "SELECT COUNT(*) FROM $table")"
  done
  printf '    %-20s %s\n' "sessions unflushed" \
    "$(sqlite3 "$STATE_DIRECTORY/vireo.db" 'SELECT COUNT(*) FROM telemetry_sessions WHERE flushed_at IS NULL')"
fi
echo "  daemon log: $(wc -l <"$TMP/daemon.log") lines, $(grep -c '^<3>' "$TMP/daemon.log" || true) at error level"
grep '^<3>' "$TMP/daemon.log" | sed 's/[0-9][0-9]*/N/g' | sort | uniq -c | sort -rn | head -20 || true
echo "  first error lines:"
grep -m 5 "^<3>" "$TMP/daemon.log" | sed "s/^/    /" || true
echo "  last lines:"
tail -n 5 "$TMP/daemon.log" | sed 's/^/    /'
exit "$status"
