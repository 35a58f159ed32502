#!/usr/bin/env bash
# Installs the Debian packages that building, running and testing Vireo need,
# only those that are missing. Needs root (or sudo) when anything is missing.
set -euo pipefail

packages=(
  build-essential cmake ninja-build pkg-config
  libsystemd-dev libsqlite3-dev nlohmann-json3-dev systemtap-sdt-dev
  libgtest-dev libgmock-dev libbenchmark-dev
  dbus-daemon sqlite3 python3-dbusmock
  # systemd-analyze checks the service units (nothing is started).
  systemd
  # The tsan and fuzz presets: Clang 14, its sanitizer and libFuzzer runtimes,
  # and llvm-symbolizer for readable reports.
  clang libclang-rt-14-dev llvm
  # The Debian package: cpack's shlibdeps needs file(1) (dpkg-dev comes with
  # build-essential); lintian checks the package, with man-db for the manual pages.
  file lintian man-db
  # The forwarder: libcurl for ClickHouse's HTTP interface; its tests start their own
  # ClickHouse server.
  libcurl4-openssl-dev clickhouse-server clickhouse-client
)

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed'; then
    missing+=("$p")
  fi
done
[ ${#missing[@]} -eq 0 ] && exit 0

echo "setup: installing ${missing[*]}" >&2
sudo=()
if [ "$(id -u)" -ne 0 ]; then
  command -v sudo >/dev/null || { echo "setup: need root to install ${missing[*]}" >&2; exit 1; }
  sudo=(sudo)
fi
export DEBIAN_FRONTEND=noninteractive
"${sudo[@]}" apt-get update -qq
"${sudo[@]}" apt-get install -y -qq --no-install-recommends "${missing[@]}"
