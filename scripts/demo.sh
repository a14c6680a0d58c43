#!/usr/bin/env bash
# Sets up the machine, builds the product and runs it on a demo root
# (./demo-root, or the directory given as the first argument).
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
cmake -S . -B build -DCMAKE_BUILD_TYPE=RelWithDebInfo -DZEPH_BUILD_TESTS=OFF >/dev/null
cmake --build build -j "$(nproc)"
root=${1:-demo-root}
./build/bin/zephcert --root "$root" init
echo "root provisioned: $root"
./build/bin/zephcert --root "$root" call ZEPH.Core.Certificate.CRT list || true
