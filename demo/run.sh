#!/usr/bin/env bash
# Renders a small farm on this machine: a control directory under the build
# directory, this host as the one render resource, its daemon, and two jobs
# for the demo renderer. "ball" renders cleanly; "hiccup" fails once at a
# frame (as a crashing renderer would) and is retried. The host has two
# processors and takes three frames a task; both jobs are immediate
# (priority 0), so both processors work. The script follows the
# job states, then shows the images, the error the queue recorded and the job
# logs, and stops the daemon.
#   demo/run.sh [BUILD_DIR]          (default: build)
#   DEMO_TIMEOUT=SECONDS             give up after this long (default 300)
set -euo pipefail

here=$(cd "$(dirname "$0")" && pwd)
# shellcheck source=demo/farm.sh
. "$here/farm.sh"
build=${1:-build}
timeout=${DEMO_TIMEOUT:-300}
farm_init "$build" "$(cd "$build" && pwd)/demo_farm"
cp -R "$here/project/sdl/." "$project/sdl/"
scene=$project/sdl/bouncing_ball.sdl

farm_resource 3 2  # 3 frames a task, 2 processors
{
  echo "RenderJobControl 0 10"
  farm_job ball 1 "$scene" 1 24 "slow=0.2"
  farm_job hiccup 2 "$scene" 1 12 "slow=0.2 fail_at=8 fail_once=$project/hiccup.failed"
  echo "End"
} >"$farm/Render_Job_Control"

echo "demo: control directory $farm"
echo "demo: starting zarno_render_demon for host $host"
farm_start
trap farm_stop EXIT

states_line() { farm_states | paste -sd ',' - | sed 's/,/,  /g'; }
start=$(date +%s)
last=""
until farm_done; do
  if ! farm_alive; then
    echo "demo: the daemon ended early; its log:" >&2
    cat "$farm/tmp/zarno_render_demon.LOG" >&2 || true
    exit 1
  fi
  if [ $(($(date +%s) - start)) -ge "$timeout" ]; then
    echo "demo: jobs not done after ${timeout}s" >&2
    farm_states >&2
    exit 1
  fi
  now=$(states_line)
  if [ "$now" != "$last" ]; then
    printf '  [%3ds]  %s\n' $(($(date +%s) - start)) "$now"
    last=$now
  fi
  sleep 0.5
done
printf '  [%3ds]  %s\n' $(($(date +%s) - start)) "$(states_line)"

echo
echo "demo: images in $project/pix:"
(cd "$project/pix" && ls -C ball.* hiccup.* 2>/dev/null) | sed 's/^/  /'
echo
echo "demo: what the queue recorded for hiccup's failed attempt:"
# The job's comment, where failed attempts pile up, between /* and */.
awk '/^hiccup [0-9]+ \{$/ { on = 1; next }
     on && /^\t\/\*/ { c = 1; sub(/^\t\/\*/, "") }
     on && c { end = sub(/\*\/$/, ""); if ($0 ~ /[^ ]/) print "  " $0; if (end) exit }' \
  "$farm/Render_Job_Control"
for j in ball hiccup; do
  echo
  echo "demo: JOBLOG/$j:"
  sed 's/^/  /' "$farm/JOBLOG/$j" 2>/dev/null || echo "  (none)"
done
echo
echo "demo: open $project/pix/ball.0001 (a PNG) to see a frame."
