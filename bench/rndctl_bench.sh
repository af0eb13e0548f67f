#!/usr/bin/env bash
# The command-line tool on a large queue, as a user meets it: whole
# processes, start-up included.
#   `rndctl jobs` on 10,000 jobs and 500 hosts: median and worst wall time of
#   R runs (target: under 150 ms), and the same with --json.
#   `rndctl watch` on that farm left idle: CPU time (user + system) of the
#   process over S seconds, as a share of one core (target: under 2 %).
#   bench/rndctl_bench.sh [BUILD_DIR]
#   BENCH_QUICK=1   5 runs and a 3-second watch (proves it runs)
set -euo pipefail

build=$(cd "${1:-build}" && pwd)
tool=$build/tools/rndctl/rndctl
[ -x "$tool" ] || { echo "rndctl_bench: $tool is missing; build first" >&2; exit 1; }
[ -x /usr/bin/time ] || { echo "rndctl_bench: skipped (needs /usr/bin/time)"; exit 0; }
if [ "${BENCH_QUICK:-0}" = 1 ]; then runs=5 watch_s=3; else runs=30 watch_s=20; fi

root=$(mktemp -d "${TMPDIR:-/tmp}/rndctl_bench.XXXXXX")
watch_pid=""
feed_pid=""
cleanup() {
  [ -n "$watch_pid" ] && kill "$watch_pid" 2>/dev/null || true
  [ -n "$feed_pid" ] && kill "$feed_pid" 2>/dev/null || true
  rm -rf "$root"
}
trap cleanup EXIT
mkdir -p "$root/TSKSTAT" "$root/JOBLOG"

# 500 resources, a quarter locked on weekdays; 10,000 jobs on three hosts
# each, a third pending and the rest part done.
awk -v devs=500 'BEGIN {
  print "RenderResourceControl"
  for (i = 0; i < devs; i++) {
    printf "render%03d %d {\n\tlock_pid \t= 0;\n\thost_name\t\t= render%03d;\n", i, i + 1, i
    printf "\tstatus \t\t\t= %s;\n", i % 4 == 0 ? "SCHEDULE" : "AVAILABLE"
    if (i % 4 == 0) printf "\tlocks =\t{ 800 to 1800 Monday to Friday };\n"
    printf "\tmax_frames \t\t= %d;\n\tnum_processors \t= %d;\n\t}\n\n", i % 10 + 1, i % 16 + 1
  }
  print "End"
}' >"$root/Render_Resource_Control"
awk -v jobs=10000 -v devs=500 'BEGIN {
  print "RenderJobControl 0 10"
  for (i = 0; i < jobs; i++) {
    last = 24 + (i * 37) % 477
    printf "shot_%05d %d {\n\tuser\t \t= artist;\n", i, i + 1
    printf "\tstatus \t\t= \"%s\";\n", i % 3 == 0 ? "pending" : "37.00%"
    printf "\tpriority \t= %d;\n\texecutable \t= zrender;\n", i % 11
    printf "\tsdl \t\t= \"/projects/show%02d/sdl/shot_%05d.sdl\";\n", i % 40, i
    printf "\tpix \t\t= \"/projects/show%02d/pix/shot_%05d\";\n", i % 40, i
    printf "\tuse_sdl_paths = FALSE;\n\tanimate\t\t= TRUE;\n"
    printf "\tframes\t\t= 1.000000, %d.000000, 1.000000;\n", last
    printf "\ttotalframes\t= %d;\n\tdoneframes\t= %d;\n", last, (i * 13) % last
    printf "\tresources\t= render%03d, render%03d, render%03d;\n}\n\n", i % devs, (i * 7 + 1) % devs, (i * 13 + 2) % devs
  }
  print "End"
}' >"$root/Render_Job_Control"
: >"$root/Render_Tasks"

jobs_listed=$("$tool" -l "$root" jobs --json | grep -c '"index"' || true)
[ "$jobs_listed" = 10000 ] || { echo "rndctl_bench: listed $jobs_listed jobs, want 10000" >&2; exit 1; }

# Wall time and CPU time (user + system) of whole runs, in ms: median and
# worst.  On a shared machine the wall time also holds the waits for a core;
# the CPU time is what the tool itself costs.
time_runs() {
  local i
  : >"$root/times"
  for ((i = 0; i < runs; i++)); do
    /usr/bin/time -a -o "$root/times" -f "%e %U %S" "$tool" -l "$root" "$@" >/dev/null
  done
  med_max() { sort -n | awk '{ v[NR] = $1 } END { printf "median %.0f ms worst %.0f ms", v[int((NR + 1) / 2)], v[NR] }'; }
  echo "wall $(awk '{ print $1 * 1000 }' "$root/times" | med_max)," \
    "cpu $(awk '{ print ($2 + $3) * 1000 }' "$root/times" | med_max) ($runs runs)"
}
echo "load average before: $(cut -d" " -f1-3 /proc/loadavg) on $(nproc) core(s)"
echo "rndctl jobs, 10,000 jobs x 500 hosts:        $(time_runs jobs)"
echo "rndctl jobs --json, 10,000 jobs x 500 hosts: $(time_runs jobs --json)"

# The live view on the idle farm: its stdin a pipe that never speaks.
mkfifo "$root/keys"
sleep $((watch_s + 30)) >"$root/keys" &
feed_pid=$!
"$tool" -l "$root" watch <"$root/keys" >/dev/null &
watch_pid=$!
sleep 1  # the first draw is not idle work
ticks=$(getconf CLK_TCK)
cpu() { awk '{ print $14 + $15 }' "/proc/$watch_pid/stat"; }
c0=$(cpu)
sleep "$watch_s"
c1=$(cpu)
kill "$watch_pid"
wait "$watch_pid" 2>/dev/null || true
watch_pid=""
awk -v d=$((c1 - c0)) -v t="$ticks" -v s="$watch_s" 'BEGIN {
  printf "rndctl watch, idle farm of 10,000 jobs:      %.2f %% of one core over %d s\n", 100 * d / t / s, s }'
