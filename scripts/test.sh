#!/usr/bin/env bash
# Sets up the machine, builds everything and runs every test.
#   ZEPH_SANITIZE=1 scripts/test.sh   runs them under ASan and UBSan
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
