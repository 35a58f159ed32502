#!/bin/sh
# Builds the Release preset "bench", starts a private session bus and the daemon with
# its directories in a temporary directory, runs hostile_load and prints its report,
# then the daemon's live status, its clean exit (SIGTERM), the rows in the store and
# the error lines of its log.
#
# Environment: REPETITIONS (3), SECONDS_PER_PHASE of pinging (10), HOSTILE connections
# (4), CLIENTS that vanish (12000), PARALLEL (8), MESSAGES into one session (150000),
# WINDOW (64), SCENARIOS (ping,vanish,flood), JOBS build jobs (2), VIREO_BENCH_BUILD
# build directory (build/bench), VIREO_BENCH_NO_BUILD=1 to skip the build,
# VIREO_BENCH_KEEP=1 to keep the temporary directory (daemon log, store).
set -eu

ROOT=$(cd "$(dirname "$0")/.." && pwd)
BUILD=${VIREO_BENCH_BUILD:-$ROOT/build/bench}
JOBS=${JOBS:-2}

if [ -z "${VIREO_BENCH_NO_BUILD:-}" ]; then
  (cd "$ROOT" && cmake --preset bench -B "$BUILD" >/dev/null)
  cmake --build "$BUILD" --parallel "$JOBS" --target vireo-reportingd vireoctl hostile_load
fi

DAEMON=${VIREO_DAEMON:-$BUILD/src/daemon/vireo-reportingd}
CTL=$BUILD/src/ctl/vireoctl
[ -x "$DAEMON" ] || { echo "no daemon at $DAEMON" >&2; exit 1; }

TMP=$(mktemp -d /tmp/vireo-hostile-XXXXXX)
BUS_PID=
DAEMON_PID=
cleanup() {
  [ -n "$DAEMON_PID" ] && kill "$DAEMON_PID" 2>/dev/null && wait "$DAEMON_PID" 2>/dev/null || true
  [ -n "$BUS_PID" ] && kill "$BUS_PID" 2>/dev/null && wait "$BUS_PID" 2>/dev/null || true
  if [ -n "${VIREO_BENCH_KEEP:-}" ]; then echo "kept $TMP"; else rm -rf "$TMP"; fi
}
trap cleanup EXIT
trap 'exit 1' HUP INT PIPE TERM

dbus-daemon --session --nofork --print-address=3 --address="unix:dir=$TMP" 3>"$TMP/address" 2>"$TMP/dbus-daemon.log" &
BUS_PID=$!
for _ in $(seq 100); do [ -s "$TMP/address" ] && break; sleep 0.05; done
DBUS_SESSION_BUS_ADDRESS=$(head -n1 "$TMP/address")
[ -n "$DBUS_SESSION_BUS_ADDRESS" ] || { echo "dbus-daemon did not start" >&2; exit 1; }

export DBUS_SESSION_BUS_ADDRESS VIREO_BUS=session
export CONFIGURATION_DIRECTORY="$TMP/conf" STATE_DIRECTORY="$TMP/state"
export LOGS_DIRECTORY="$TMP/log" RUNTIME_DIRECTORY="$TMP/run"
unset JOURNAL_STREAM DBUS_STARTER_BUS_TYPE VIREO_VERBOSE || true
mkdir -p "$CONFIGURATION_DIRECTORY" "$STATE_DIRECTORY" "$LOGS_DIRECTORY" "$RUNTIME_DIRECTORY"

"$DAEMON" 2>"$TMP/daemon.log" &
DAEMON_PID=$!
for _ in $(seq 200); do "$CTL" ping >/dev/null 2>&1 && break; sleep 0.05; done
"$CTL" ping >/dev/null || { echo "the daemon did not come up" >&2; cat "$TMP/daemon.log" >&2; exit 1; }

status=0
"$BUILD/bench/hostile_load" --pid "$DAEMON_PID" --db "$STATE_DIRECTORY/vireo.db" \
  --repetitions "${REPETITIONS:-3}" --scenarios "${SCENARIOS:-ping,vanish,flood}" \
  --seconds "${SECONDS_PER_PHASE:-10}" --hostile "${HOSTILE:-4}" \
  --clients "${CLIENTS:-12000}" --parallel "${PARALLEL:-8}" \
  --messages "${MESSAGES:-150000}" --window "${WINDOW:-64}" || status=$?

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
