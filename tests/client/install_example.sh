#!/bin/bash
# Installs the client component into a temporary prefix, checks the library's soname,
# builds examples/session.cpp against it the usual way (pkg-config without --static,
# and CMake's find_package) and runs it against the daemon on a private bus.
#
# install_example.sh BUILD_DIR SOURCE_DIR DAEMON LIBDIR SONAME CXX [COMPILER FLAGS...]
set -euo pipefail
build=$1 source=$2 daemon=$3 libdir=$4 soname=$5 cxx=$6
shift 6
flags=("$@")

tmp=$(mktemp -d /tmp/vireo-install-XXXXXX)
bus_pid="" daemon_pid=""
cleanup() {
  [ -z "$daemon_pid" ] || kill "$daemon_pid" 2>/dev/null || true
  [ -z "$bus_pid" ] || kill "$bus_pid" 2>/dev/null || true
  wait 2>/dev/null || true
  rm -rf "$tmp"
}
trap cleanup EXIT
fail() {
  echo "FAIL: $*" >&2
  [ ! -f "$tmp/daemon.log" ] || sed 's/^/daemon: /' "$tmp/daemon.log" >&2
  exit 1
}

prefix=$tmp/prefix
cmake --install "$build" --prefix "$prefix" --component client >/dev/null
lib=$prefix/$libdir
[ -L "$lib/libvireo-client.so" ] || fail "no development link $lib/libvireo-client.so"
readelf -d "$lib/libvireo-client.so" | grep -q "(SONAME).*\[$soname\]" || fail "soname is not $soname"
[ -z "$(find "$prefix" -name '*.a' -o -name 'vireo-reportingd')" ] || fail "more than the client component installed"

export PKG_CONFIG_PATH=$lib/pkgconfig
# shellcheck disable=SC2046 # pkg-config's output is meant to be split
"$cxx" "${flags[@]}" "$source/examples/session.cpp" $(pkg-config --cflags --libs vireo-client) -o "$tmp/session" ||
  fail "the example does not build with pkg-config --cflags --libs vireo-client"
readelf -d "$tmp/session" | grep -q "(NEEDED).*\[$soname\]" || fail "the example does not load $soname"

cmake -S "$source/examples" -B "$tmp/cmake-build" -G Ninja -DCMAKE_PREFIX_PATH="$prefix" \
  -DCMAKE_CXX_COMPILER="$cxx" -DCMAKE_CXX_FLAGS="${flags[*]}" >"$tmp/cmake.log" 2>&1 ||
  { cat "$tmp/cmake.log" >&2; fail "find_package(vireo) failed"; }
cmake --build "$tmp/cmake-build" >"$tmp/cmake.log" 2>&1 || { cat "$tmp/cmake.log" >&2; fail "vireo::client does not link"; }

# A private bus and the daemon on it.
mkdir -p "$tmp"/{conf,state,logs,run}
dbus-daemon --session --nofork --print-address=3 --address="unix:dir=$tmp" 3>"$tmp/address" &
bus_pid=$!
for _ in $(seq 100); do [ -s "$tmp/address" ] && break; sleep 0.1; done
address=$(head -n1 "$tmp/address")
[ -n "$address" ] || fail "dbus-daemon did not start"
env -u DBUS_STARTER_BUS_TYPE -u JOURNAL_STREAM CONFIGURATION_DIRECTORY="$tmp/conf" STATE_DIRECTORY="$tmp/state" \
  LOGS_DIRECTORY="$tmp/logs" RUNTIME_DIRECTORY="$tmp/run" VIREO_BUS=session DBUS_SESSION_BUS_ADDRESS="$address" \
  DBUS_SYSTEM_BUS_ADDRESS="unix:path=$tmp/no-system-bus" "$daemon" >"$tmp/daemon.log" 2>&1 &
daemon_pid=$!
up=""
for _ in $(seq 200); do
  if dbus-send --bus="$address" --print-reply --dest=com.orvane.vireo.Reporting1 /com/orvane/vireo/Reporting1 \
    org.freedesktop.DBus.Peer.Ping >/dev/null 2>&1; then up=1 && break; fi
  kill -0 "$daemon_pid" 2>/dev/null || break
  sleep 0.1
done
[ -n "$up" ] || fail "the daemon did not come up"

for example in "$tmp/session" "$tmp/cmake-build/session"; do
  LD_LIBRARY_PATH=$lib DBUS_SESSION_BUS_ADDRESS=$address VIREO_BUS=session "$example" || fail "$example failed"
done
echo "ok: $soname, pkg-config and find_package builds, the example ran"
