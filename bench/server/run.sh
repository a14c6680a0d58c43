#!/usr/bin/env bash
# Benchmark of zeph-webapid: the "list" of 100 certificates over HTTPS with
# keep-alive at 8 connections (wrk), the server's resident memory when idle
# and after the load, and the same method called in the process
# (webapid_bench_list) for comparison.
#
#   bench/server/run.sh [BUILD_DIR] [SECONDS]
#
# BUILD_DIR (default build) must hold zeph-webapid, zephcert,
# webapid_bench_list and the module:
#   cmake --build build --target zeph-webapid zephcert webapid_bench_list
set -euo pipefail
cd "$(dirname "$0")/../.."
build=${1:-build}
seconds=${2:-20}
bin=$build/bin
for tool in zeph-webapid zephcert webapid_bench_list; do
  if [ ! -x "$bin/$tool" ]; then
    echo "missing $bin/$tool: cmake --build $build --target $tool" >&2
    exit 2
  fi
done
command -v wrk >/dev/null || { echo "wrk is missing: scripts/setup.sh" >&2; exit 2; }

work=$(mktemp -d)
root=$work/root
pid=
cleanup() {
  if [ -n "$pid" ]; then kill "$pid" 2>/dev/null || true; wait "$pid" 2>/dev/null || true; fi
  chmod -R u+rwx "$work"
  rm -rf "$work"
}
trap cleanup EXIT

"$bin/zephcert" --root "$root" init
archive=$root/usr/zeph/etc/certificate/_archive

# 100 certificates: RSA 2048 keys, subjects with every name field,
# alternative names, and an authority file each (listed too).
echo "making 100 certificates ..."
info="{"
for i in $(seq 1 100); do
  id=$(printf 'bn%04d' "$i")
  dir=$archive/$id
  mkdir -p "$dir"
  openssl req -x509 -newkey rsa:2048 -nodes -days 365 \
    -keyout "$dir/privkey.pem" -out "$dir/cert.pem" \
    -subj "/C=DE/ST=Berlin/L=Berlin/O=Zeph/OU=IT/CN=host$i.example/emailAddress=admin@example.com" \
    -addext "subjectAltName=DNS:host$i.example,IP:10.0.0.$i" 2>/dev/null
  cp "$dir/cert.pem" "$dir/fullchain.pem"
  cp "$dir/cert.pem" "$dir/zeph-ca-cert.pem"
  [ "$i" -gt 1 ] && info+=","
  info+="\"$id\":{\"desc\":\"bench $i\",\"services\":[],\"user_deletable\":true}"
done
printf '%s}\n' "$info" > "$archive/INFO"
echo bn0001 > "$archive/DEFAULT"
# The web administration service uses the first one.
service=$(sed -e 's/^\[//' -e 's/\]$//' "$archive/SERVICES")
"$bin/zephcert" --root "$root" call ZEPH.Core.Certificate.Service set \
  "{\"settings\":[{\"service\":$service,\"id\":\"bn0001\",\"old_id\":\"\"}]}" >/dev/null

"$bin/zeph-webapid" --root "$root" --listen 127.0.0.1:0 2>"$work/server.log" &
pid=$!
for _ in $(seq 1 200); do
  grep -q 'listening on' "$work/server.log" && break
  sleep 0.05
done
port=$(grep -o 'https://127.0.0.1:[0-9]*' "$work/server.log" | sed 's/.*://')
WEBAPID_TOKEN=$(cat "$root/usr/zeph/etc/webapid/token")
export WEBAPID_TOKEN
url=https://127.0.0.1:$port/api/ZEPH.Core.Certificate.CRT/1/list

count=$(curl -sk -X POST -H "Authorization: Bearer $WEBAPID_TOKEN" \
  -H 'Content-Type: application/json' -d '{}' "$url" | grep -o '"id":"bn' | wc -l)
echo "certificates listed over HTTPS: $count"
sleep 1
mib() { awk -v k="$1" '$1 == k":" {printf "%.1f MiB", $2 / 1024}' "/proc/$pid/status"; }
echo "server idle: RSS $(mib VmRSS)"

echo "wrk: 1 thread, 1 keep-alive connection, ${seconds}s"
wrk -t1 -c1 -d"${seconds}s" --latency -s bench/server/list.lua "$url"
echo "wrk: 2 threads, 8 keep-alive connections, ${seconds}s"
wrk -t2 -c8 -d"${seconds}s" --latency -s bench/server/list.lua "$url"
echo "server after the load: RSS $(mib VmRSS), peak $(mib VmHWM)"
sleep 6  # past the keep-alive time-out: the connections' threads go idle
echo "server idle again: RSS $(mib VmRSS)"

"$bin/webapid_bench_list" --root "$root" --calls 300
"$bin/webapid_bench_list" --root "$root" --calls 400 --threads 8
