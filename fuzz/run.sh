#!/usr/bin/env bash
# Runs one fuzz target for a bounded time:
#   fuzz/run.sh FUZZER SEED_DIR BUILD_DIR SECONDS
# The committed seeds are read, never written: what the run finds goes to
# BUILD_DIR/fuzz-corpus/<target>, a crashing input to BUILD_DIR/fuzz-artifacts.
# Exits non-zero when the target crashed, leaked or timed out.
set -euo pipefail
fuzzer=$1 seeds=$2 build=$3 seconds=$4
name=$(basename "$fuzzer")
corpus="$build/fuzz-corpus/$name"
artifacts="$build/fuzz-artifacts"
mkdir -p "$corpus" "$artifacts"
exec "$fuzzer" -max_total_time="$seconds" -timeout=30 -rss_limit_mb=4096 \
  -print_final_stats=1 -artifact_prefix="$artifacts/$name-" \
  "$corpus" "$seeds"
