# Sourced by the bench runners: builds TARGETS of the Release preset "bench" (unless
# VIREO_BENCH_NO_BUILD is set), then starts a private session bus and the daemon with
# its directories in a fresh temporary directory, and waits until it answers. Sets
# ROOT, BUILD, DAEMON, CTL, TMP, DAEMON_PID and the daemon's directory variables;
# stops both and removes TMP (unless VIREO_BENCH_KEEP is set) on exit.
#
# In: TARGETS, TMP_PREFIX, JOBS (2), VIREO_BENCH_BUILD (build/bench), VIREO_DAEMON.
ROOT=$(cd "$(dirname "$0")/.." && pwd)
BUILD=${VIREO_BENCH_BUILD:-$ROOT/build/bench}

if [ -z "${VIREO_BENCH_NO_BUILD:-}" ]; then
  (cd "$ROOT" && cmake --preset bench -B "$BUILD" >/dev/null)
  # shellcheck disable=SC2086 # a list of targets
  cmake --build "$BUILD" --parallel "${JOBS:-2}" --target vireo-reportingd vireoctl $TARGETS
fi

DAEMON=${VIREO_DAEMON:-$BUILD/src/daemon/vireo-reportingd}
CTL=$BUILD/src/ctl/vireoctl
[ -x "$DAEMON" ] || { echo "no daemon at $DAEMON" >&2; exit 1; }

TMP=$(mktemp -d "/tmp/${TMP_PREFIX:-vireo-bench}-XXXXXX")
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
# A run writes a few hundred MiB of rows: without this the store's quota would delete
# some of them, and the reports count rows stored against messages accepted.
echo "MaxStoreBytes=0" >"$CONFIGURATION_DIRECTORY/telemetry.conf"

"$DAEMON" 2>"$TMP/daemon.log" &
DAEMON_PID=$!
for _ in $(seq 200); do "$CTL" ping >/dev/null 2>&1 && break; sleep 0.05; done
"$CTL" ping >/dev/null || { echo "the daemon did not come up" >&2; cat "$TMP/daemon.log" >&2; exit 1; }
