#!/usr/bin/env bash
# Dispatch throughput of one daemon: how fast it cuts tasks off a job, starts
# the renderer, notices it ended and writes the outcome back. The renderer
# paints tiny images, so the figures are the queue's own cost per task.
#   bench/dispatch_bench.sh [BUILD_DIR]     (default: build)
#   BENCH_QUICK=1                           a few tasks only (proves it runs)
set -euo pipefail

here=$(cd "$(dirname "$0")" && pwd)
# shellcheck source=demo/farm.sh
. "$here/../demo/farm.sh"
build=$(cd "${1:-build}" && pwd)
quick=${BENCH_QUICK:-0}
frames=60
[ "$quick" = 1 ] && frames=6
limit=${DISPATCH_TIMEOUT:-600}

now_ms() { echo $(($(date +%s%N) / 1000000)); }

# Renders one job of $frames frames cut into pieces of $1 frames; prints one
# result line.
run_case() {  # frames_per_task processors
  local per_task=$1 processors=$2 tasks start first="" t elapsed
  farm_init "$build" "$build/bench_farm"
  printf 'animation = ON;\nstartframe = 1;\nendframe = %d;\nbyframe = 1;\nsize = 8x6;\n' \
    "$frames" >"$project/sdl/tiny.sdl"
  farm_resource "$per_task" "$processors"
  {
    echo "RenderJobControl 0 10"
    farm_job tiny 1 "$project/sdl/tiny.sdl" 1 "$frames" "size=8x6"
    echo "End"
  } >"$farm/Render_Job_Control"
  tasks=$(((frames + per_task - 1) / per_task))

  start=$(now_ms)
  farm_start
  until farm_done; do
    t=$(now_ms)
    if [ -z "$first" ] && [ -e "$project/pix/tiny.0001" ]; then first=$((t - start)); fi
    if ! farm_alive || [ $((t - start)) -ge $((limit * 1000)) ]; then
      echo "dispatch: job not done (daemon ended or ${limit}s passed); states: $(farm_states)" >&2
      farm_stop
      return 1
    fi
    sleep 0.02
  done
  elapsed=$(($(now_ms) - start))
  farm_stop
  if [ "$(farm_states)" != "tiny: finished" ]; then
    echo "dispatch: job ended as $(farm_states)" >&2
    return 1
  fi
  awk -v n="$tasks" -v f="$frames" -v p="$per_task" -v ms="$elapsed" -v first="${first:-0}" \
    'BEGIN { printf "%3d frames/task  %4d tasks  %7.0f ms  %7.1f ms/task  %6.1f tasks/s  first frame %5d ms\n",
             p, n, ms, ms / n, n * 1000.0 / ms, first }'
}

trap farm_stop EXIT
echo "dispatch: one host, $frames frames of 8x6, from daemon start to the job finished"
status=0
run_case 1 1 || status=1
run_case 10 1 || status=1
rm -rf "$build/bench_farm"
exit $status
