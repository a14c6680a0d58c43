#!/usr/bin/env bash
# Benchmark of zeph-webapid behind its nginx: the "list" of 100
# certificates over HTTPS with keep-alive at 1 and 8 connections (wrk), the
# resident memory of the whole process tree (zeph-webapid, nginx's master
# and workers) when idle and after the load, how soon new connections get a
# certificate bound by another program, the attacks of the server's tests
# (webapid_bench_attacks), and the same method called in the process
# (webapid_bench_list) for comparison.
#
#   bench/server/run.sh [BUILD_DIR] [SECONDS]
#
# BUILD_DIR (default build) must hold zeph-webapid, zephcert,
# webapid_bench_list, webapid_bench_attacks and the module:
#   cmake --build build --target zeph-webapid zephcert webapid_bench_list webapid_bench_attacks
set -euo pipefail
cd "$(dirname "$0")/../.."
build=${1:-build}
seconds=${2:-20}
bin=$build/bin
for tool in zeph-webapid zephcert webapid_bench_list webapid_bench_attacks; do
  if [ ! -x "$bin/$tool" ]; then
    echo "missing $bin/$tool: cmake --build $build --target $tool" >&2
    exit 2
  fi
done
command -v wrk >/dev/null || { echo "wrk is missing: scripts/setup.sh" >&2; exit 2; }

work=$(mktemp -d)
# Started as root, nginx's workers run as www-data and must reach the root.
chmod 755 "$work"
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
# The sum of FIELD (VmRSS, VmHWM) over the server and every process below it.
kib() {
  local pids=$pid p total=0 v
  for p in $(ps -e -o pid=,ppid= | awk -v root="$pid" '
      { parent[$1] = $2 }
      END { for (p in parent) { q = p; while (q in parent && q != root && q > 1) q = parent[q]; if (q == root && p != root) print p } }'); do
    pids="$pids $p"
  done
  for p in $pids; do
    v=$(awk -v k="$1" '$1 == k":" {print $2}' "/proc/$p/status" 2>/dev/null || true)
    total=$((total + ${v:-0}))
  done
  echo "$total"
}
# Prints the resident memory and its "result:" line (see bench/run).
memory() {  # WHAT FIELD
  local k
  k=$(kib "$2")
  awk -v w="$1" -v k="$k" 'BEGIN {
    printf "%s: %.1f MiB\n", w, k / 1024
    printf "result: server | %s | %.1f | MiB\n", w, k / 1024 }'
}
# Passes wrk's report through and adds its "result:" lines.
wrk_results() {  # LABEL
  awk -v l="$1" '
    function ms(t) {
      if (t ~ /us$/) return t / 1000
      if (t ~ /ms$/) return t + 0
      if (t ~ /s$/) return t * 1000
      return t
    }
    { print }
    $1 == "50%" { printf "result: server | %s, p50 | %.1f | ms\n", l, ms($2) }
    $1 == "99%" { printf "result: server | %s, p99 | %.1f | ms\n", l, ms($2) }
    $1 == "Requests/sec:" { printf "result: server | %s, throughput | %.1f | requests/s\n", l, $2 }'
}
# Passes webapid_bench_list's line through and adds its "result:" lines.
inprocess_results() {  # LABEL
  awk -v l="$1" '
    { print }
    /^in-process list/ {
      for (i = 1; i <= NF; ++i) {
        if ($i == "calls/s,") printf "result: server | %s, throughput | %s | calls/s\n", l, $(i - 1)
        if ($i == "p50") printf "result: server | %s, p50 | %s | ms\n", l, $(i + 1)
        if ($i == "p99") printf "result: server | %s, p99 | %s | ms\n", l, $(i + 1)
      }
    }'
}
memory "tree RSS idle" VmRSS

echo "wrk: 1 thread, 1 keep-alive connection, ${seconds}s"
wrk -t1 -c1 -d"${seconds}s" --latency -s bench/server/list.lua "$url" |
  wrk_results "HTTPS list of 100, 1 connection"
echo "wrk: 2 threads, 8 keep-alive connections, ${seconds}s"
wrk -t2 -c8 -d"${seconds}s" --latency -s bench/server/list.lua "$url" |
  wrk_results "HTTPS list of 100, 8 connections (target p99 < 50 ms)"
memory "tree RSS after the load" VmRSS
memory "tree RSS peak (sum of each process's peak)" VmHWM
sleep 11  # past nginx's keep-alive time-out
memory "tree RSS idle again" VmRSS

# Another program binds another certificate to the web administration
# service: how long until a new connection is presented it.
fingerprint() {
  openssl s_client -connect "127.0.0.1:$port" </dev/null 2>/dev/null |
    openssl x509 -noout -fingerprint -sha256 2>/dev/null | sed 's/.*=//'
}
handover_ms=()
old=bn0001
for new in bn0002 bn0003 bn0004 bn0005 bn0006; do
  want=$(openssl x509 -in "$archive/$new/cert.pem" -noout -fingerprint -sha256 | sed 's/.*=//')
  "$bin/zephcert" --root "$root" call ZEPH.Core.Certificate.Service set \
    "{\"settings\":[{\"service\":$service,\"id\":\"$new\",\"old_id\":\"$old\"}]}" >/dev/null
  start=$(date +%s%N)
  while [ "$(fingerprint)" != "$want" ]; do
    [ $(( ($(date +%s%N) - start) / 1000000 )) -gt 10000 ] && break
  done
  handover_ms+=($(( ($(date +%s%N) - start) / 1000000 )))
  old=$new
done
echo "certificate bound by zephcert, ms until new connections get it: ${handover_ms[*]}"
printf '%s\n' "${handover_ms[@]}" | sort -n | awk '
  { v[NR] = $1 } END {
    printf "result: server | certificate bound by zephcert until presented, median of %d (target <= 1000) | %d | ms\n", NR, v[int((NR + 1) / 2)]
    printf "result: server | certificate bound by zephcert until presented, max | %d | ms\n", v[NR] }'

# The attacks of the server's tests, with the memory of the tree meanwhile.
head -c 300000000 /dev/zero | gzip -9 > "$work/bomb.gz"
"$bin/webapid_bench_attacks" --port "$port" --token "$WEBAPID_TOKEN" --pid "$pid" \
  --bomb "$work/bomb.gz"
memory "tree RSS after the attacks" VmRSS

"$bin/webapid_bench_list" --root "$root" --calls 300 |
  inprocess_results "list of 100 in the process, 1 thread"
"$bin/webapid_bench_list" --root "$root" --calls 400 --threads 8 |
  inprocess_results "list of 100 in the process, 8 threads"
