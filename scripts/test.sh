#!/usr/bin/env bash
# Sets up the machine, builds everything and runs every test, then each
# fuzz target for a bounded time (scripts/fuzz.sh).
#   ZEPH_SANITIZE=1 scripts/test.sh   runs the tests under ASan and UBSan
#                                     (the fuzz targets always are)
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
build_dir=build
options=()
if [ "${ZEPH_SANITIZE:-0}" = 1 ]; then
  build_dir=build-sanitize
  options+=(-DZEPH_SANITIZE=ON)
fi
cmake -S . -B "$build_dir" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DZEPH_BUILD_TESTS=ON "${options[@]}"
cmake --build "$build_dir" -j "$(nproc)"
ctest --test-dir "$build_dir" --output-on-failure -j "$(nproc)"
scripts/fuzz.sh
