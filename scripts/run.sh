#!/usr/bin/env bash
# Builds the daemon and runs it in the foreground on the session bus, keeping its
# state under the user's XDG directories. With no session bus around, it starts a
# private one for the daemon's lifetime and prints its address.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
cmake --preset release >/dev/null
cmake --build --preset release
daemon=build/release/src/daemon/vireo-reportingd

if [ -z "${DBUS_SESSION_BUS_ADDRESS:-}" ]; then
  rundir=$(mktemp -d "${TMPDIR:-/tmp}/vireo-bus.XXXXXX")
  address=$(dbus-daemon --session --fork --print-address=1 --print-pid=3 \
    --address="unix:path=$rundir/bus" 3>"$rundir/pid")
  trap 'kill "$(cat "$rundir/pid")" 2>/dev/null; rm -rf "$rundir"' EXIT
  export DBUS_SESSION_BUS_ADDRESS="$address"
  echo "vireo: private session bus; in another shell: export DBUS_SESSION_BUS_ADDRESS='$address'" >&2
fi
export VIREO_BUS="${VIREO_BUS:-session}"

# Root would otherwise get the system directories; this command is for a user's trial run.
xdg_config="${XDG_CONFIG_HOME:-$HOME/.config}"
xdg_state="${XDG_STATE_HOME:-$HOME/.local/state}"
xdg_runtime="${XDG_RUNTIME_DIR:-${TMPDIR:-/tmp}/vireo-runtime-$(id -u)}"
export CONFIGURATION_DIRECTORY="${CONFIGURATION_DIRECTORY:-$xdg_config/vireo}"
export STATE_DIRECTORY="${STATE_DIRECTORY:-$xdg_state/vireo}"
export LOGS_DIRECTORY="${LOGS_DIRECTORY:-$xdg_state/vireo/log}"
export RUNTIME_DIRECTORY="${RUNTIME_DIRECTORY:-$xdg_runtime/vireo}"
"$daemon" "$@"
