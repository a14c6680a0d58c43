#!/usr/bin/env bash
# Builds the libFuzzer targets with clang (ASan and UBSan) in build-fuzz
# and runs each for a bounded time on its committed seeds.
#   ZEPH_FUZZ_SECONDS=N scripts/fuzz.sh   N seconds per target (default 20)
# A crashing input is left in build-fuzz/fuzz-artifacts.
set -euo pipefail
cd "$(dirname "$0")/.."
seconds=${ZEPH_FUZZ_SECONDS:-20}
cmake -S . -B build-fuzz -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++ \
  -DZEPH_FUZZ=ON -DZEPH_BUILD_TESTS=OFF -DZEPH_FUZZ_SECONDS="$seconds"
cmake --build build-fuzz --target fuzzers -j "$(nproc)"
ctest --test-dir build-fuzz --output-on-failure -j "$(nproc)"
