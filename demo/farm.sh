# shellcheck shell=bash
# Shell helpers for a one-host render farm under a scratch directory, shared
# by the demo and the dispatch benchmark. Source it, then:
#   farm_init BUILD_DIR FARM_DIR     (sets farm, project, host, daemon)
#   farm_resource MAX_FRAMES PROCESSORS
#   { echo "RenderJobControl 0 10"; farm_job ...; echo End; } >"$farm/Render_Job_Control"
#   farm_start; ... farm_done ...; farm_stop
# Paths are absolute throughout: the daemon changes its working directory to
# a job's project (the directory holding "sdl") before starting each render.

farm_init() {  # build_dir_or_install_prefix farm_dir
  local build exe
  build=$(cd "$1" && pwd)
  daemon=$build/zarno_render_demon
  # An install prefix keeps the daemon beside the render programs.
  [ -x "$build/bin/zarno_render_demon" ] && daemon=$build/bin/zarno_render_demon
  painter_bin=$build/bin
  for exe in "$daemon" "$painter_bin/frame_painter"; do
    if [ ! -x "$exe" ]; then
      echo "$exe is missing; build first" >&2
      return 1
    fi
  done
  farm=$2
  project=$farm/project
  host=$(uname -n)
  rm -rf "$farm"
  mkdir -p "$farm/tmp" "$project/pix" "$project/sdl"
  daemon_pid=""
}

farm_resource() {  # max_frames processors
  cat >"$farm/Render_Resource_Control" <<END_OF_RESOURCES
RenderResourceControl
$host 1 {
	lock_pid 	= 0;
	host_name		= $host;
	status 			= AVAILABLE;
	max_frames 		= $1;
	num_processors 	= $2;
	}

End
END_OF_RESOURCES
}

# One job block as the queue's own writer lays it out; whole frame numbers,
# extensions counted from the first frame, four digits.
farm_job() {  # name index scene first last rnd_opts [executable]
  cat <<END_OF_JOB
$1 $2 {
	user	 	= ${USER:-demo};
	status 		= "pending";
	priority 	= 0;
	executable 	= ${7:-frame_painter};
	sdl 		= "$3";
	pix 		= "$project/pix/$1";
	use_sdl_paths = FALSE;
	output_mask = FALSE;
	animate		= TRUE;
	frames		= $4.000000, $5.000000, 1.000000;
	extension	= $4, 1, 4;
	rnd_opts	= "$6";
	totalframes	= $(($5 - $4 + 1));
	doneframes	= 0;
	resources	= $host;
}

END_OF_JOB
}

farm_start() {
  DRCTMPDIR=$farm/tmp PATH=$painter_bin:$PATH "$daemon" -l "$farm" &
  daemon_pid=$!
}

farm_alive() { [ -n "$daemon_pid" ] && kill -0 "$daemon_pid" 2>/dev/null; }

farm_stop() {
  local _
  farm_alive || return 0
  # A daemon whose pid file is gone leaves at its next wake-up; the alarm
  # makes that wake-up now.
  rm -f "$farm/$host.pid"
  kill -ALRM "$daemon_pid" 2>/dev/null || true
  for _ in $(seq 50); do
    farm_alive || break
    sleep 0.1
  done
  if farm_alive; then kill -TERM "$daemon_pid" 2>/dev/null || true; fi
  wait "$daemon_pid" 2>/dev/null || true
  daemon_pid=""
}

# The status text of each job, "name: status" a line.
farm_states() {
  awk '/^[^ \t].* [0-9]+ \{$/ { name = $1 }
       /^\tstatus / { s = $0; sub(/^[^"]*"/, "", s); sub(/".*$/, "", s); print name ": " s }' \
    "$farm/Render_Job_Control" 2>/dev/null || true
}

# True once every job is finished or failed.
farm_done() {
  local states
  states=$(farm_states)
  [ -n "$states" ] || return 1
  ! echo "$states" | grep -vqE ': (finished|failed)$'
}
