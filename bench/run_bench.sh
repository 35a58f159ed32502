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

CLIENTS=${CLIENTS:-8}
MESSAGES=${MESSAGES:-4000}
PIPELINED_MESSAGES=${PIPELINED_MESSAGES:-20000}
WINDOW=${WINDOW:-64}
REPETITIONS=${REPETITIONS:-3}
BROADCAST=${BROADCAST:-1}
PING=${PING:-1}
CYCLE_CLIENTS=${CYCLE_CLIENTS:-4}
CYCLES=${CYCLES:-200}

TARGETS="session_cycle_load message_load" TMP_PREFIX=vireo-bench
. "$(dirname "$0")/private_daemon.sh"

echo "== session cycles"
"$BUILD/bench/session_cycle_load" --clients "$CYCLE_CLIENTS" --cycles "$CYCLES"
echo
echo "== messages"
"$BUILD/bench/message_load" --clients "$CLIENTS" --messages "$MESSAGES" \
  --pipelined-messages "$PIPELINED_MESSAGES" --window "$WINDOW" --repetitions "$REPETITIONS" \
  --broadcast "$BROADCAST" --ping "$PING" --db "$STATE_DIRECTORY/vireo.db" --pid "$DAEMON_PID"
