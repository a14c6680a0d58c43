#!/usr/bin/env bash
# Builds everything with gcov instrumentation in build-coverage, runs the
# tests there (not the fuzz targets) and prints line and branch coverage of
# the product's code: module/, platform/, host/, server/, cli/, tools/ and
# acme/,
# test files and test helpers left out. Branches that only throw or that the
# compiler made unreachable are not counted.
#   scripts/coverage.sh            the summary
#   ZEPH_COVERAGE_HTML=DIR ...     also an HTML report per file into DIR
#   ZEPH_COVERAGE_JSON=FILE ...    also gcovr's JSON of every line and branch
#                                  (to compare two runs file by file)
# The per-file text report goes to build-coverage/coverage.txt (gcovr replaces
# its output file, so it must never be pointed at a device such as /dev/null).
# A failing test is reported but does not stop the report.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
build=build-coverage
cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=Debug -DZEPH_BUILD_TESTS=ON -DZEPH_COVERAGE=ON
cmake --build "$build" -j "$(nproc)"
find "$build" -name '*.gcda' -delete
status=0
ctest --test-dir "$build" --output-on-failure -j "$(nproc)" || status=$?

filters=()
for dir in module platform host server cli tools acme; do
  filters+=(--filter "$PWD/$dir/")
done
excludes=(--exclude '.*_test\.cc$' --exclude '.*_test_.*' --exclude '.*test_support.*'
          --exclude '.*_testing\.(cc|h)$' --exclude '.*test_util.*')
html=()
if [ -n "${ZEPH_COVERAGE_HTML:-}" ]; then
  mkdir -p "$ZEPH_COVERAGE_HTML"
  html=(--html-details "$ZEPH_COVERAGE_HTML/index.html")
fi
if [ -n "${ZEPH_COVERAGE_JSON:-}" ]; then
  html+=(--json "$ZEPH_COVERAGE_JSON")
fi
gcovr --root "$PWD" --object-directory "$build" "${filters[@]}" "${excludes[@]}" \
      --exclude-throw-branches --exclude-unreachable-branches \
      --gcov-ignore-parse-errors --print-summary "${html[@]+"${html[@]}"}" \
      --output "$build/coverage.txt"
[ "$status" -eq 0 ] || echo "coverage.sh: some tests failed (ctest status $status)" >&2
exit 0
