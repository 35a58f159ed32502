#!/usr/bin/env bash
# Builds Vireo and runs every test three ways: under AddressSanitizer and
# UndefinedBehaviorSanitizer (GCC), under ThreadSanitizer (Clang), and the libFuzzer
# targets for VIREO_FUZZ_SECONDS each (default 30). Each preset has its own build/<preset>.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh

# stage PRESET [CONFIGURE-ARGS...]
stage() {
  local name=$1
  shift
  local start=$SECONDS
  echo "==== $name" >&2
  cmake --preset "$name" "$@"
  cmake --build --preset "$name"
  ctest --preset "$name"
  echo "==== $name: $((SECONDS - start)) s" >&2
}

stage ci
stage tsan
stage fuzz -DVIREO_FUZZ_SECONDS="${VIREO_FUZZ_SECONDS:-30}"
