#!/bin/sh
# Builds the Release preset "bench", starts a private session bus and the daemon with
# its directories in a temporary directory, runs both load tools and prints their
# reports. The message load runs three shapes (1 client synchronous, 1 client
# pipelined, CLIENTS clients synchronous), each REPETITIONS times against its floor,
# and reports medians; with the defaults it takes about one and a half to two minutes.
#
# Environment: CLIENTS (8), MESSAGES per client and phase, synchronous (4000),
# PIPELINED_MESSAGES per phase (20000), WINDOW calls in flight (64), REPETITIONS (3),
# BROADCAST=0 / PING=0 to leave out those secondary lines,
# CYCLE_CLIENTS (4), CYCLES per client (200), JOBS build jobs (2),
# VIREO_BENCH_BUILD build directory (build/bench), VIREO_BENCH_NO_BUILD=1 to skip the
# build, VIREO_BENCH_KEEP=1 to keep the temporary directory (daemon log, store).
set -eu

ROOT=$(cd "$(dirname "$0")/.." && pwd)
BUILD=${VIREO_BENCH_BUILD:-$ROOT/build/bench}
CLIENTS=${CLIENTS:-8}
MESSAGES=${MESSAGES:-4000}
PIPELINED_MESSAGES=${PIPELINED_MESSAGES:-20000}
WINDOW=${WINDOW:-64}
REPETITIONS=${REPETITIONS:-3}
BROADCAST=${BROADCAST:-1}
PING=${PING:-1}
CYCLE_CLIENTS=${CYCLE_CLIENTS:-4}
CYCLES=${CYCLES:-200}
JOBS=${JOBS:-2}

if [ -z "${VIREO_BENCH_NO_BUILD:-}" ]; then
  (cd "$ROOT" && cmake --preset bench -B "$BUILD" >/dev/null)
  cmake --build "$BUILD" --parallel "$JOBS" --target vireo-reportingd vireoctl session_cycle_load message_load
fi

DAEMON=${VIREO_DAEMON:-$BUILD/src/daemon/vireo-reportingd}
[ -x "$DAEMON" ] || { echo "no daemon at $DAEMON" >&2; exit 1; }

TMP=$(mktemp -d /tmp/vireo-bench-XXXXXX)
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
for _ in $(seq 200); do "$BUILD/src/ctl/vireoctl" ping >/dev/null 2>&1 && break; sleep 0.05; done
"$BUILD/src/ctl/vireoctl" ping >/dev/null || { echo "the daemon did not come up" >&2; cat "$TMP/daemon.log" >&2; exit 1; }

echo "== session cycles"
"$BUILD/bench/session_cycle_load" --clients "$CYCLE_CLIENTS" --cycles "$CYCLES"
echo
echo "== messages"
"$BUILD/bench/message_load" --clients "$CLIENTS" --messages "$MESSAGES" \
  --pipelined-messages "$PIPELINED_MESSAGES" --window "$WINDOW" --repetitions "$REPETITIONS" \
  --broadcast "$BROADCAST" --ping "$PING" --db "$STATE_DIRECTORY/vireo.db" --pid "$DAEMON_PID"
