#!/usr/bin/env bash
# Runs every fuzzer of a fuzz build for a bounded time, each from its seed corpus.
set -euo pipefail
build=$(cd "$1" && pwd)
seconds=${2:-60}
here=$(cd "$(dirname "$0")" && pwd)
status=0
for f in "$build"/tests/fuzz/*_fuzz; do
  [ -x "$f" ] || continue
  name=$(basename "$f")
  work=$(mktemp -d)
  seeds="$here/corpus/${name%_fuzz}"
  [ -d "$seeds" ] && cp -r "$seeds"/. "$work"/
  if [ "$name" = control_file_fuzz ]; then  # the golden files seed it too
    for g in plain lenient; do
      for seed in "$here"/../golden/$g/*; do cp "$seed" "$work/$g-$(basename "$seed")"; done
    done
  fi
  echo "== $name for ${seconds}s"
  if ! (cd "$work" && "$f" -max_total_time="$seconds" -rss_limit_mb=2048 -print_final_stats=1 "$work" 2>&1 | tail -n 12); then
    status=1
  fi
  rm -rf "$work"
done
exit $status
