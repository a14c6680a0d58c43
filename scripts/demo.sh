#!/usr/bin/env bash
# Sets up the machine, builds the product, provisions a demo root (./demo-root,
# or the directory given as the first argument) and runs the web API server on
# it at https://127.0.0.1:8443 until interrupted.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
cmake -S . -B build -DCMAKE_BUILD_TYPE=RelWithDebInfo -DZEPH_BUILD_TESTS=OFF >/dev/null
cmake --build build -j "$(nproc)"
root=${1:-demo-root}
./build/bin/zephcert --root "$root" init
echo "root provisioned: $root"
./build/bin/zephcert --root "$root" call ZEPH.Core.Certificate.CRT list
echo

./build/bin/zeph-webapid --root "$root" &
server=$!
trap 'kill "$server" 2>/dev/null; wait "$server" 2>/dev/null' INT TERM EXIT
token_file="$root/usr/zeph/etc/webapid/token"
for _ in $(seq 50); do
  [ -s "$token_file" ] && break
  sleep 0.1
done
echo "access token: $(cat "$token_file")"
echo "try: curl -k -X POST -H \"Authorization: Bearer \$(cat $token_file)\" \\"
echo "       https://127.0.0.1:8443/api/ZEPH.Core.Certificate.CRT/1/list"
wait "$server"
