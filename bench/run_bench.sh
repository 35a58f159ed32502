#!/bin/sh
# Builds the Release preset "bench", starts a private session bus and the daemon with
# its directories in a temporary directory, runs the load tools and prints their
# reports. The message load runs three shapes (1 client synchronous, 1 client
# pipelined, CLIENTS clients synchronous), each REPETITIONS times against its floor,
# and reports medians; then come the daemon's work per message without the bus
# (message_path_bench) and the session scale report (hostile_load's idle, wait and
# flood scenarios). About six minutes in all with the defaults.
#
# Environment: CLIENTS (8), MESSAGES per client and phase, synchronous (4000),
# PIPELINED_MESSAGES per phase (20000), WINDOW calls in flight (64), REPETITIONS (3),
# BROADCAST=0 / PING=0 to leave out those secondary lines, SCALE=0 to leave out the
# session scale report (about four minutes: SESSIONS idle and waiting sessions (10000),
# SCALE_MESSAGES into one session (200000)),
# CYCLE_CLIENTS (4), CYCLES per client (200), JOBS build jobs (2),
# VIREO_BENCH_BUILD build directory (build/bench), VIREO_BENCH_NO_BUILD=1 to skip the
# build, VIREO_BENCH_KEEP=1 to keep the temporary directory (daemon log, store).
set -eu

CLIENTS=${CLIENTS:-8}
MESSAGES=${MESSAGES:-4000}
PIPELINED_MESSAGES=${PIPELINED_MESSAGES:-20000}
WINDOW=${WINDOW:-64}
REPETITIONS=${REPETITIONS:-3}
BROADCAST=${BROADCAST:-1}
PING=${PING:-1}
CYCLE_CLIENTS=${CYCLE_CLIENTS:-4}
CYCLES=${CYCLES:-200}

TARGETS="session_cycle_load message_load message_path_bench hostile_load" TMP_PREFIX=vireo-bench
. "$(dirname "$0")/private_daemon.sh"

echo "== session cycles"
"$BUILD/bench/session_cycle_load" --clients "$CYCLE_CLIENTS" --cycles "$CYCLES"
echo
echo "== messages"
"$BUILD/bench/message_load" --clients "$CLIENTS" --messages "$MESSAGES" \
  --pipelined-messages "$PIPELINED_MESSAGES" --window "$WINDOW" --repetitions "$REPETITIONS" \
  --broadcast "$BROADCAST" --ping "$PING" --db "$STATE_DIRECTORY/vireo.db" --pid "$DAEMON_PID"
echo
echo "== the daemon's work per message, without the bus"
"$BUILD/bench/message_path_bench" --benchmark_repetitions="$REPETITIONS" \
  --benchmark_report_aggregates_only=true --benchmark_color=false 2>/dev/null

if [ "${SCALE:-1}" != 0 ]; then
  echo
  echo "== session scale"
  "$BUILD/bench/hostile_load" --pid "$DAEMON_PID" --db "$STATE_DIRECTORY/vireo.db" \
    --repetitions "$REPETITIONS" --scenarios idle,wait,flood --window "$WINDOW" \
    --sessions "${SESSIONS:-10000}" --messages "${SCALE_MESSAGES:-200000}"
fi
