#!/usr/bin/env bash
# fuzz/run.sh FUZZER SEED_DIR BUILD_DIR SECONDS: new inputs go to BUILD_DIR/fuzz-corpus, a
# crashing one to BUILD_DIR/fuzz-artifacts; the committed seeds are only read.
set -euo pipefail
fuzzer=$1 seeds=$2 build=$3 seconds=$4
name=$(basename "$fuzzer")
mkdir -p "$build/fuzz-corpus/$name" "$build/fuzz-artifacts"
exec "$fuzzer" -max_total_time="$seconds" -timeout=30 -rss_limit_mb=4096 \
  -print_final_stats=1 -artifact_prefix="$build/fuzz-artifacts/$name-" \
  "$build/fuzz-corpus/$name" "$seeds"
