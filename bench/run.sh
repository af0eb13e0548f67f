#!/usr/bin/env bash
# Runs every benchmark of a build and reports the figures.
#   bench/run.sh BUILD_DIR        full runs
#   BENCH_QUICK=1 bench/run.sh B  one short repetition each (CI: proves they run)
set -euo pipefail
build=${1:-build}
here=$(cd "$(dirname "$0")" && pwd)
quick=${BENCH_QUICK:-0}
status=0
args=()
[ "$quick" = 1 ] && args+=(--benchmark_min_time=0.01)
found=0
for b in "$build"/bench/*_bench; do
  [ -x "$b" ] || continue
  found=1
  echo "== $(basename "$b")"
  "$b" "${args[@]}" || status=1
done
for s in "$here"/*_bench.sh; do
  [ -x "$s" ] || continue
  found=1
  echo "== $(basename "$s")"
  BENCH_QUICK=$quick "$s" "$build" || status=1
done
[ "$found" = 1 ] || echo "no benchmarks built in $build"
exit $status
