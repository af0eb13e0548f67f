#!/usr/bin/env bash
# Renders a small farm on this machine: a control directory under the build
# directory, this host as the one render resource, its daemon, and two jobs
# for the demo renderer. "ball" renders cleanly; "hiccup" fails once at a
# frame (as a crashing renderer would) and is retried. The host has two
# processors and takes three frames a task; both jobs are immediate
# (priority 0), so both processors work. The script follows the
# job states, then shows the images, the error the queue recorded and the job
# logs, and stops the daemon.
#   demo/run.sh [BUILD_DIR]          (default: build; an install prefix works too)
#   DEMO_TIMEOUT=SECONDS             give up after this long (default 300)
#   DEMO_RENDERER=blender|povray     render the ball with a real renderer
#                                    instead (one 6-frame job, 2 frames a task)
set -euo pipefail

here=$(cd "$(dirname "$0")" && pwd)
# shellcheck source=demo/farm.sh
. "$here/farm.sh"
build=${1:-build}
timeout=${DEMO_TIMEOUT:-300}
farm_init "$build" "$(cd "$build" && pwd)/demo_farm"
renderer=${DEMO_RENDERER:-}
jobs="ball hiccup"
case $renderer in
  "")
    cp -R "$here/project/sdl/." "$project/sdl/"
    scene=$project/sdl/bouncing_ball.sdl
    farm_resource 3 2  # 3 frames a task, 2 processors
    {
      echo "RenderJobControl 0 10"
      farm_job ball 1 "$scene" 1 24 "slow=0.2"
      farm_job hiccup 2 "$scene" 1 12 "slow=0.2 fail_at=8 fail_once=$project/hiccup.failed"
      echo "End"
    } >"$farm/Render_Job_Control"
    ;;
  blender | povray)
    command -v "$renderer" >/dev/null || {
      echo "demo: $renderer is not installed (RJ_WITH_RENDERERS=1 tools/install-deps.sh)" >&2
      exit 1
    }
    if [ "$renderer" = blender ]; then
      scene=$project/sdl/ball.blend
      echo "demo: making $scene"
      blender -b --factory-startup --python "$here/blender/make_scene.py" -- "$scene" >/dev/null
    else
      cp "$here/povray/ball.pov" "$here/povray/ball.ini" "$project/sdl/"
      scene=$project/sdl/ball.ini
    fi
    jobs=ball
    farm_resource 2 2
    {
      echo "RenderJobControl 0 10"
      farm_job ball 1 "$scene" 1 6 "" "${renderer}_render"
      echo "End"
    } >"$farm/Render_Job_Control"
    ;;
  *)
    echo "demo: DEMO_RENDERER must be blender or povray" >&2
    exit 2
    ;;
esac

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
(cd "$project/pix" && ls -C ball.* hiccup.* 2>/dev/null || true) | sed 's/^/  /'
if [ "$jobs" = "ball hiccup" ]; then
  echo
  echo "demo: what the queue recorded for hiccup's failed attempt:"
  # The job's comment, where failed attempts pile up, between /* and */.
  awk '/^hiccup [0-9]+ \{$/ { on = 1; next }
       on && /^\t\/\*/ { c = 1; sub(/^\t\/\*/, "") }
       on && c { end = sub(/\*\/$/, ""); if ($0 ~ /[^ ]/) print "  " $0; if (end) exit }' \
    "$farm/Render_Job_Control"
fi
for j in $jobs; do
  echo
  echo "demo: JOBLOG/$j:"
  sed 's/^/  /' "$farm/JOBLOG/$j" 2>/dev/null || echo "  (none)"
done
echo
echo "demo: open $project/pix/ball.0001 (a PNG) to see a frame."
