#!/usr/bin/env bash
# Builds the daemon and runs it in the foreground on the session bus, keeping its
# state under the user's XDG directories (root's too: this is a trial run, not the
# system service). With no session bus around, it starts a private one for the
# daemon's lifetime.
#
# Once the daemon answers, standard output gets exactly one line, to paste into
# another shell so that vireoctl reaches this daemon and its store; the build and
# the daemon's log go to standard error. Ctrl-C (or SIGTERM) stops the daemon.
#
#   VIREO_BUILD_DIR=DIR   the build to run (default build/release)
#   VIREO_RUN_NO_BUILD=1  run what DIR holds, without installing packages or building
set -euo pipefail
cd "$(dirname "$0")/.."
build="${VIREO_BUILD_DIR:-build/release}"
if [ -z "${VIREO_RUN_NO_BUILD:-}" ]; then
  scripts/setup.sh >&2
  cmake --preset release >/dev/null
  cmake --build --preset release >&2
fi
build=$(cd "$build" && pwd)
daemon="$build/src/daemon/vireo-reportingd"
ctl="$build/src/ctl/vireoctl"

rundir=""
daemon_pid=""
cleanup() {
  if [ -n "$daemon_pid" ]; then kill -TERM "$daemon_pid" 2>/dev/null || true; fi
  if [ -n "$rundir" ]; then
    kill "$(cat "$rundir/pid" 2>/dev/null)" 2>/dev/null || true
    rm -rf "$rundir"
  fi
}
trap cleanup EXIT

if [ -z "${DBUS_SESSION_BUS_ADDRESS:-}" ]; then
  rundir=$(mktemp -d "${TMPDIR:-/tmp}/vireo-bus.XXXXXX")
  DBUS_SESSION_BUS_ADDRESS=$(dbus-daemon --session --fork --print-address=1 --print-pid=3 \
    --address="unix:path=$rundir/bus" 3>"$rundir/pid")
  export DBUS_SESSION_BUS_ADDRESS
  echo "vireo: started a private session bus at $DBUS_SESSION_BUS_ADDRESS" >&2
fi
export VIREO_BUS=session

xdg_config="${XDG_CONFIG_HOME:-$HOME/.config}"
xdg_state="${XDG_STATE_HOME:-$HOME/.local/state}"
xdg_runtime="${XDG_RUNTIME_DIR:-${TMPDIR:-/tmp}/vireo-runtime-$(id -u)}"
export CONFIGURATION_DIRECTORY="${CONFIGURATION_DIRECTORY:-$xdg_config/vireo}"
export STATE_DIRECTORY="${STATE_DIRECTORY:-$xdg_state/vireo}"
export LOGS_DIRECTORY="${LOGS_DIRECTORY:-$xdg_state/vireo/log}"
export RUNTIME_DIRECTORY="${RUNTIME_DIRECTORY:-$xdg_runtime/vireo}"

# In the background so that Ctrl-C and SIGTERM reach the trap below, which hands
# them on; the daemon's stdout joins its log on stderr.
"$daemon" "$@" >&2 &
daemon_pid=$!
trap 'kill -TERM "$daemon_pid" 2>/dev/null || true' INT TERM

quote() { printf "'%s'" "${1//\'/\'\\\'\'}"; }
answered=""
for _ in $(seq 100); do
  kill -0 "$daemon_pid" 2>/dev/null || break
  if "$ctl" --timeout 1 ping >/dev/null 2>&1; then
    answered=1
    break
  fi
  sleep 0.1
done
if [ -n "$answered" ]; then
  echo "export VIREO_BUS=session DBUS_SESSION_BUS_ADDRESS=$(quote "$DBUS_SESSION_BUS_ADDRESS")" \
    "CONFIGURATION_DIRECTORY=$(quote "$CONFIGURATION_DIRECTORY") STATE_DIRECTORY=$(quote "$STATE_DIRECTORY")"
else
  echo "vireo: the daemon does not answer on $DBUS_SESSION_BUS_ADDRESS" >&2
fi

status=0
wait "$daemon_pid" || status=$?
# A signal cut the wait short: wait again for the daemon's own status.
if [ "$status" -gt 128 ]; then
  status=0
  wait "$daemon_pid" || status=$?
fi
daemon_pid=""
exit "$status"
