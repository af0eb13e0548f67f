#!/usr/bin/env bash
# Dispatch on one host: 2 processors, an immediate (priority 0) job of 120
# frames, 1 frame a task, each frame taking 0.5 s to render.  Reports the
# makespan against the ideal (frames / processors x 0.5 s) and the dispatch
# latency: from a render program's exit to the start of the next one
# (median and 95th percentile).  The render program is wrapped by a script
# that notes when it starts and when it ends.
#   bench/dispatch_bench.sh [BUILD_DIR]     (default: build)
#   BENCH_QUICK=1                           12 frames only (proves it runs)
set -euo pipefail

here=$(cd "$(dirname "$0")" && pwd)
# shellcheck source=demo/farm.sh
. "$here/../demo/farm.sh"
build=$(cd "${1:-build}" && pwd)
frames=120
seconds_per_frame=0.5
[ "${BENCH_QUICK:-0}" = 1 ] && frames=12
processors=2
limit=${DISPATCH_TIMEOUT:-600}

farm_init "$build" "$build/bench_farm"
mkdir -p "$farm/bin"
times=$farm/times
: >"$times"
cat >"$farm/bin/timed_painter" <<END_OF_WRAPPER
#!/bin/sh
echo "start \$(date +%s%N)" >>"$times"
"$painter_bin/frame_painter" "\$@"
rc=\$?
echo "end \$(date +%s%N)" >>"$times"
exit \$rc
END_OF_WRAPPER
chmod +x "$farm/bin/timed_painter"
printf 'animation = ON;\nstartframe = 1;\nendframe = %d;\nbyframe = 1;\nsize = 8x6;\n' \
  "$frames" >"$project/sdl/tiny.sdl"
farm_resource 1 "$processors"
{
  echo "RenderJobControl 0 10"
  farm_job tiny 1 "$project/sdl/tiny.sdl" 1 "$frames" "size=8x6 slow=$seconds_per_frame" |
    sed 's/= frame_painter;/= timed_painter;/'
  echo "End"
} >"$farm/Render_Job_Control"

trap farm_stop EXIT
PATH=$farm/bin:$PATH
start=$(date +%s%N)
farm_start
until farm_done; do
  if ! farm_alive || [ $((($(date +%s%N) - start) / 1000000000)) -ge "$limit" ]; then
    echo "dispatch: job not done (daemon ended or ${limit}s passed); states: $(farm_states)" >&2
    exit 1
  fi
  sleep 0.05
done
farm_stop
if [ "$(farm_states)" != "tiny: finished" ]; then
  echo "dispatch: job ended as $(farm_states)" >&2
  exit 1
fi

# Makespan: first start to last end.  Latency: each start after the first
# `processors` ones, minus the latest end before it.
sort -k2,2n "$times" | awk -v frames="$frames" -v p="$processors" -v spf="$seconds_per_frame" '
  $1 == "start" { starts++; if (first == "") first = $2;
                  if (starts > p && last_end != "") lat[n++] = ($2 - last_end) / 1e6 }
  $1 == "end"   { last_end = $2; final = $2 }
  END {
    makespan = (final - first) / 1e9; ideal = frames / p * spf
    for (i = 0; i < n; i++) for (j = i + 1; j < n; j++) if (lat[j] < lat[i]) { t = lat[i]; lat[i] = lat[j]; lat[j] = t }
    med = n ? lat[int((n - 1) / 2)] : 0; p95 = n ? lat[int(0.95 * (n - 1))] : 0
    printf "dispatch: %d frames on %d processors, %.1f s a frame, 1 frame a task\n", frames, p, spf
    printf "  makespan %.2f s, ideal %.2f s, efficiency %.1f%% (target >= 90%%)\n", makespan, ideal, 100 * ideal / makespan
    printf "  dispatch latency over %d starts: median %.1f ms, p95 %.1f ms (target median < 50 ms)\n", n, med, p95
  }'
rm -rf "$build/bench_farm"
