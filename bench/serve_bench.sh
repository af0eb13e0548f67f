#!/usr/bin/env bash
# The status page server on a large idle queue: `rndctl serve` on a control
# directory of N jobs (10,000), nothing changing.  Reports
#   the median and 95th percentile time of GET /api/jobs (served from the
#   parsed state), the size of the answer, and
#   the server's CPU (user+system, % of one core) over S seconds with P pages
#   open, each polling /api/changed every 500 ms as the page does.
#   bench/serve_bench.sh [BUILD_DIR]
#   BENCH_QUICK=1   1,000 jobs, 3 seconds (proves it runs)
set -euo pipefail
build=$(cd "${1:-build}" && pwd)
tool=$build/tools/rndctl/rndctl
[ -x "$tool" ] || { echo "serve_bench: $tool is missing; build first" >&2; exit 1; }
command -v curl >/dev/null || { echo "serve_bench: skipped (needs curl)"; exit 0; }
"$tool" serve --help >/dev/null 2>&1 || { echo "serve_bench: skipped (rndctl built without serve)"; exit 0; }
jobs=10000 seconds=20 pages=10 requests=60
if [ "${BENCH_QUICK:-0}" = 1 ]; then jobs=1000 seconds=3 requests=10; fi

dir=$(mktemp -d)
server=
trap '[ -n "$server" ] && kill "$server" 2>/dev/null; wait 2>/dev/null; rm -rf "$dir"' EXIT
ctl=$dir/ctl
mkdir -p "$ctl"
printf 'RenderResourceControl\nhostA 1 {\n\thost_name\t= hostA;\n\tstatus\t= AVAILABLE;\n\tmax_frames\t= 3;\n\tnum_processors\t= 2;\n\t}\n\nEnd\n' \
  >"$ctl/Render_Resource_Control"
awk -v n="$jobs" 'BEGIN {
  print "RenderJobControl 0 0";
  for (i = 1; i <= n; i++) {
    printf "job%d %d {\n\tuser\t \t= bench;\n\tstatus \t\t= \"%.2f%% \";\n\tpriority \t= 1;\n", i, i, (i % 100);
    printf "\texecutable \t= frame_painter;\n\tsdl \t\t= \"/proj/sdl/s%d.sdl\";\n\tpix \t\t= \"pix/job%d\";\n", i, i;
    printf "\tanimate\t\t= TRUE;\n\tframes\t\t= 1.000000, 100.000000, 1.000000;\n";
    printf "\ttotalframes\t= 100;\n\tdoneframes\t= %d;\n}\n\n", i % 100;
  }
  print "End";
}' >"$ctl/Render_Job_Control"

port=$(( 20000 + RANDOM % 20000 ))
"$tool" -l "$ctl" serve --listen 127.0.0.1:$port >"$dir/out" 2>&1 &
server=$!
url=http://127.0.0.1:$port
for _ in $(seq 100); do curl -sf "$url/api/changed" >/dev/null && break; sleep 0.1; done
count=$(curl -sf "$url/api/jobs" | grep -o '"index":' | wc -l)
[ "$count" = "$jobs" ] || { echo "serve_bench: the server lists $count jobs, not $jobs" >&2; cat "$dir/out" >&2; exit 1; }

for _ in $(seq "$requests"); do
  curl -s -o /dev/null -w '%{time_total} %{size_download}\n' "$url/api/jobs"
done | sort -n >"$dir/times"
median=$(awk '{ t[NR] = $1 } END { printf "%.1f", t[int((NR + 1) / 2)] * 1000 }' "$dir/times")
p95=$(awk '{ t[NR] = $1 } END { i = int(NR * 0.95); if (i < 1) i = 1; printf "%.1f", t[i] * 1000 }' "$dir/times")
size=$(awk 'NR == 1 { print $2 }' "$dir/times")
echo "jobs api, $jobs jobs: median ${median} ms, p95 ${p95} ms, ${size} bytes"

ticks() { awk '{ print $14 + $15 }' "/proc/$server/stat"; }
hz=$(getconf CLK_TCK)
pollers=()
for _ in $(seq "$pages"); do
  ( end=$((SECONDS + seconds)); while [ $SECONDS -lt $end ]; do
      curl -s -o /dev/null "$url/api/changed?since=1"; sleep 0.5; done ) &
  pollers+=($!)
done
t0=$(ticks); s0=$(date +%s.%N)
wait "${pollers[@]}"
t1=$(ticks); s1=$(date +%s.%N)
awk -v a="$t0" -v b="$t1" -v hz="$hz" -v s0="$s0" -v s1="$s1" -v p="$pages" \
  'BEGIN { printf "idle farm, %d pages polling: server cpu %.2f%% of one core over %.0f s\n", p, (b - a) / hz / (s1 - s0) * 100, s1 - s0 }'
