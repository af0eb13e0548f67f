#!/usr/bin/env bash
# Renders a small farm on this machine: a control directory under the build
# directory, this host as the one render resource, its daemon, and two jobs
# for the demo renderer. "ball" renders cleanly; "hiccup" fails once at a
# frame (as a crashing renderer would) and is retried from the frame it
# reached. The script follows the job states, then shows the images, the
# error the queue recorded and the job logs, and stops the daemon.
#   demo/run.sh [BUILD_DIR]          (default: build)
#   DEMO_TIMEOUT=SECONDS             give up after this long (default 300)
set -euo pipefail

here=$(cd "$(dirname "$0")" && pwd)
build=$(cd "${1:-build}" && pwd)
daemon=$build/zarno_render_demon
painter=$build/bin/frame_painter
timeout=${DEMO_TIMEOUT:-300}
for exe in "$daemon" "$painter"; do
  if [ ! -x "$exe" ]; then
    echo "demo: $exe is missing; build first (make demo does)" >&2
    exit 1
  fi
done

# Everything below is absolute: the daemon changes its working directory to
# the project (the directory holding "sdl") before starting each render.
farm=$build/demo_farm
project=$farm/project
host=$(uname -n)
rm -rf "$farm"
mkdir -p "$farm/tmp" "$project/pix"
cp -R "$here/project/sdl" "$project/"
scene=$project/sdl/bouncing_ball.sdl

cat >"$farm/Render_Resource_Control" <<EOF
RenderResourceControl
$host 1 {
	lock_pid 	= 0;
	host_name		= $host;
	status 			= AVAILABLE;
	max_frames 		= 6;
	num_processors 	= 2;
	}

End
EOF

# A job block as the queue's own writer lays it out.
job_block() {  # name index first last rnd_opts
  cat <<EOF
$1 $2 {
	user	 	= ${USER:-demo};
	status 		= "pending";
	priority 	= 0;
	executable 	= frame_painter;
	sdl 		= "$scene";
	pix 		= "$project/pix/$1";
	use_sdl_paths = FALSE;
	output_mask = FALSE;
	animate		= TRUE;
	frames		= $3.000000, $4.000000, 1.000000;
	extension	= $3, 1, 4;
	rnd_opts	= "$5";
	totalframes	= $(($4 - $3 + 1));
	doneframes	= 0;
	resources	= $host;
}

EOF
}
{
  echo "RenderJobControl 0 10"
  job_block ball 1 1 24 "slow=0.2"
  job_block hiccup 2 1 12 "slow=0.2 fail_at=8 fail_once=$project/hiccup.failed"
  echo "End"
} >"$farm/Render_Job_Control"

echo "demo: control directory $farm"
echo "demo: starting zarno_render_demon for host $host"
DRCTMPDIR=$farm/tmp PATH=$build/bin:$PATH "$daemon" -l "$farm" &
daemon_pid=$!

stop_daemon() {
  kill -0 "$daemon_pid" 2>/dev/null || return 0
  # A daemon whose pid file is gone leaves at its next wake-up; the alarm
  # makes that wake-up now.
  rm -f "$farm/$host.pid"
  kill -ALRM "$daemon_pid" 2>/dev/null || true
  for _ in $(seq 50); do
    kill -0 "$daemon_pid" 2>/dev/null || break
    sleep 0.1
  done
  if kill -0 "$daemon_pid" 2>/dev/null; then kill -TERM "$daemon_pid" 2>/dev/null || true; fi
  wait "$daemon_pid" 2>/dev/null || true
}
trap stop_daemon EXIT

# The status text of each job, "name: status" a line.
job_states() {
  awk '/^[^ \t].* [0-9]+ \{$/ { name = $1 }
       /^\tstatus / { s = $0; sub(/^[^"]*"/, "", s); sub(/".*$/, "", s); print name ": " s }' \
    "$farm/Render_Job_Control" 2>/dev/null || true
}

done_all() {
  local states
  states=$(job_states)
  [ -n "$states" ] || return 1
  ! echo "$states" | grep -vqE ': (finished|failed)$'
}

start=$(date +%s)
last=""
until done_all; do
  if ! kill -0 "$daemon_pid" 2>/dev/null; then
    echo "demo: the daemon ended early; its log:" >&2
    cat "$farm/tmp/zarno_render_demon.LOG" >&2 || true
    exit 1
  fi
  if [ $(($(date +%s) - start)) -ge "$timeout" ]; then
    echo "demo: jobs not done after ${timeout}s" >&2
    job_states >&2
    exit 1
  fi
  now=$(job_states | paste -sd ',' - | sed 's/,/,  /g')
  if [ "$now" != "$last" ]; then
    printf '  [%3ds]  %s\n' $(($(date +%s) - start)) "$now"
    last=$now
  fi
  sleep 0.5
done
printf '  [%3ds]  %s\n' $(($(date +%s) - start)) "$(job_states | paste -sd ',' - | sed 's/,/,  /g')"

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
