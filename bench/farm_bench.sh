#!/usr/bin/env bash
# The farm at scale: H daemons on one control directory, each in a UTS
# namespace of its own under its own host name (needs root), one job of N
# frames cut one frame a task, the stamping render program sleeping the frame
# time T.  Each host has 1 processor (the 1-host case: 2, priority 0).
# Reports per setting:
#   makespan (first daemon start to last frame end), ideal N*T/(H*procs),
#   efficiency, time from each daemon's start to its first frame (max and
#   median), slot gap (a render's end to the next start on the same host
#   slot: median and 95th percentile), frames per host (min/max).
#   bench/farm_bench.sh [BUILD_DIR]
#   BENCH_QUICK=1            4 hosts x 20 frames x 0.5 s only (proves it runs)
#   FARM_BENCH_SETTINGS="H:N:T:P ..."   other settings (P: processors a host)
#   FARM_BENCH_SSHFS=1       also run the 4-host settings with each host on
#                            its own sshfs mount and report both efficiencies
#   FARM_BENCH_FS=build      keep the farms in the build directory instead of
#                            on a journaled ext4 file system of their own
#
# The control directories lie on a fresh journaled ext4 file system in an
# image file (loop device), as on a file server's disk.  The root file system
# of the virtual machines this runs on has no journal; there ext4 skips, for
# every file it makes, each inode freed in the last minutes, and a farm whose
# every lock makes and removes a directory and two files spends most of its
# processor time in that scan, the more the longer benchmarks have run.
set -euo pipefail

here=$(cd "$(dirname "$0")" && pwd)
build=$(cd "${1:-build}" && pwd)
daemon=$build/zarno_render_demon
render_bin=$build/bin
farm_host=$build/bench/farm_host
for exe in "$daemon" "$render_bin/stamp_render" "$farm_host"; do
  [ -x "$exe" ] || { echo "farm_bench: $exe is missing; build first" >&2; exit 1; }
done
if [ "$(id -u)" != 0 ] || ! command -v unshare >/dev/null; then
  echo "farm_bench: skipped (needs root and unshare: each host runs in its own UTS namespace)"
  exit 0
fi

if [ "${BENCH_QUICK:-0}" = 1 ]; then
  settings=${FARM_BENCH_SETTINGS:-"4:20:0.5:1"}
else
  settings=${FARM_BENCH_SETTINGS:-"1:120:0.5:2 4:40:1:1 4:20:5:1 16:64:5:1 50:500:10:1 100:1000:10:1"}
fi
root=$build/farm_bench
image=$build/farm_bench.img
mounted=0
sshd_pid=""
pids=()

stop_all() {
  local p
  for p in "${pids[@]}"; do kill -KILL "$p" 2>/dev/null || true; done
  # (the shell's own note of each killed job goes too)
  { for p in "${pids[@]}"; do wait "$p" || true; done; } 2>/dev/null
  pkill_renders
  pids=()
}
# Ends the render programs of this benchmark by pid (never by name alone).
pkill_renders() {
  local p
  for p in /proc/[0-9]*; do
    if { tr '\0' ' ' <"$p/cmdline"; } 2>/dev/null | grep -qE "^([^ ]*/)?stamp_render .*$root"; then
      kill -KILL "${p#/proc/}" 2>/dev/null || true
    fi
  done
}
cleanup() {
  stop_all
  [ -n "$sshd_pid" ] && kill "$sshd_pid" 2>/dev/null || true
  if [ -n "${FARM_BENCH_KEEP:-}" ]; then
    [ "$mounted" = 1 ] && echo "farm_bench: kept on $image, mounted at $root"
    return 0
  fi
  if [ "$mounted" = 1 ]; then
    umount "$root" 2>/dev/null || umount -l "$root" 2>/dev/null || true
    rm -f "$image"
  fi
  rm -rf "$root"
}
trap cleanup EXIT

start_sshd() {  # sets sshd_port, ssh_dir; false when sshfs cannot be used
  ssh_dir=$root/ssh
  command -v sshfs >/dev/null && [ -x /usr/sbin/sshd ] && [ -c /dev/fuse ] || return 1
  mkdir -p "$ssh_dir" /run/sshd
  ssh-keygen -q -t ed25519 -N '' -f "$ssh_dir/host_key" </dev/null
  ssh-keygen -q -t ed25519 -N '' -f "$ssh_dir/client_key" </dev/null
  cp "$ssh_dir/client_key.pub" "$ssh_dir/authorized_keys"
  sshd_port=$(python3 -c 'import socket; s=socket.socket(); s.bind(("127.0.0.1",0)); print(s.getsockname()[1])')
  cat >"$ssh_dir/sshd_config" <<END
ListenAddress 127.0.0.1
Port $sshd_port
HostKey $ssh_dir/host_key
AuthorizedKeysFile $ssh_dir/authorized_keys
PermitRootLogin prohibit-password
PasswordAuthentication no
UsePAM no
StrictModes no
PidFile $ssh_dir/sshd.pid
Subsystem sftp internal-sftp
MaxStartups 200
LogLevel ERROR
END
  /usr/sbin/sshd -D -e -f "$ssh_dir/sshd_config" 2>"$ssh_dir/sshd.log" &
  sshd_pid=$!
  sleep 0.5
  kill -0 "$sshd_pid" 2>/dev/null
}

resources() {  # hosts procs
  local i
  echo "RenderResourceControl"
  for ((i = 0; i < $1; i++)); do
    printf 'fb%d %d {\n\tlock_pid \t= 0;\n\thost_name\t\t= fb%d;\n\tstatus \t\t\t= AVAILABLE;\n' "$i" $((i + 1)) "$i"
    printf '\tmax_frames \t\t= 1;\n\tnum_processors \t= %d;\n\t}\n\n' "$2"
  done
  echo "End"
}

job() {  # hosts frames seconds
  local i list=""
  for ((i = 0; i < $1; i++)); do list+="${list:+, }fb$i"; done
  cat <<END
RenderJobControl 0 10
bench 1 {
	user	 	= bench;
	status 		= "pending";
	priority 	= 0;
	executable 	= stamp_render;
	sdl 		= "$farm/project/sdl/bench.sdl";
	pix 		= "$farm/project/pix/bench";
	use_sdl_paths = FALSE;
	output_mask = FALSE;
	animate		= TRUE;
	frames		= 1.000000, $2.000000, 1.000000;
	rnd_opts	= "sleep=$3";
	totalframes	= $2;
	doneframes	= 0;
	resources	= $list;
}

End
END
}

job_state() {
  awk '/^\tstatus / { s = $0; sub(/^[^"]*"/, "", s); sub(/".*$/, "", s); print s; exit }' \
    "$farm/ctl/Render_Job_Control" 2>/dev/null || true
}

# run_setting H N T P MODE  (MODE: local or sshfs); prints one report block
# and sets `efficiency`.
run_setting() {
  local hosts=$1 frames=$2 seconds=$3 procs=$4 mode=$5 i ctl start limit failed=0
  farm=$root/$hosts-$frames-$seconds-$mode
  rm -rf "$farm"
  mkdir -p "$farm/ctl" "$farm/project/sdl" "$farm/project/pix"
  : >"$farm/project/sdl/bench.sdl"
  ctl=$farm/ctl
  resources "$hosts" "$procs" >"$ctl/Render_Resource_Control"
  job "$hosts" "$frames" "$seconds" >"$ctl/Render_Job_Control"
  : >"$farm/stamps"
  : >"$farm/starts"
  limit=$(awk -v n="$frames" -v t="$seconds" -v h="$hosts" -v p="$procs" \
    'BEGIN { printf "%d", 5 * n * t / (h * p) + 120 }')
  for ((i = 0; i < hosts; i++)); do
    mkdir -p "$farm/tmp$i"
    # A host starts when its daemon does (farm_host notes the time): the
    # mount before it is the machine's, not the queue's.
    local dir=$ctl
    local host=("$farm_host" "fb$i" "$farm/starts" "$daemon" -l)
    local debug=(${FARM_BENCH_DEBUG:+-d 1})
    if [ "$mode" = sshfs ]; then
      dir=$farm/mnt$i
      mkdir -p "$dir"
      local script="sshfs -f -o cache=no,StrictHostKeyChecking=no,UserKnownHostsFile=/dev/null,LogLevel=ERROR,IdentityFile=$ssh_dir/client_key,port=$sshd_port root@127.0.0.1:$ctl $dir & "
      script+="for i in \$(seq 600); do [ -e $dir/Render_Job_Control ] && break; sleep 0.05; done; "
      script+='exec "$0" "$@"'
      DRCTMPDIR=$farm/tmp$i STAMP_FILE=$farm/stamps PATH=$render_bin:$PATH \
        unshare -u -m --propagation private /bin/sh -c "$script" "${host[@]}" "$dir" "${debug[@]}" \
        >"$farm/tmp$i/early" 2>&1 &
    else
      DRCTMPDIR=$farm/tmp$i STAMP_FILE=$farm/stamps PATH=$render_bin:$PATH \
        unshare -u "${host[@]}" "$dir" "${debug[@]}" >"$farm/tmp$i/early" 2>&1 &
    fi
    pids+=($!)
  done
  start=$(date +%s)
  until [ "$(job_state)" = finished ]; do
    if [ $(($(date +%s) - start)) -ge "$limit" ]; then
      echo "  $hosts x ($frames x ${seconds} s) $mode: not finished after ${limit} s (job: $(job_state))"
      efficiency=0
      stop_all
      return 1
    fi
    sleep 0.1
  done
  stop_all
  awk -v H="$hosts" -v N="$frames" -v T="$seconds" -v P="$procs" -v mode="$mode" '
    function sort(a, n,   i, j, t) { for (i = 1; i < n; i++) for (j = i; j > 0 && a[j-1] > a[j]; j--) { t = a[j]; a[j] = a[j-1]; a[j-1] = t } }
    function pct(a, n, q) { return n ? a[int(q * (n - 1))] : 0 }
    FNR == NR { started[$1] = $2; if (first == "" || $2 < first) first = $2; next }
    { host = $1; s = $3; e = $4; count[host]++; n_r++; rs[n_r] = s; re[n_r] = e; rh[n_r] = host
      if (!(host in ff) || s < ff[host]) ff[host] = s; if (e > last) last = e }
    END {
      # Gaps: per host in start order, each render takes the slot that came
      # free last before it started.
      for (i = 1; i <= n_r; i++) order[i-1] = sprintf("%s %020.0f %d", rh[i], rs[i], i)
      sort(order, n_r)
      ng = 0
      for (k = 0; k < n_r; k++) {
        split(order[k], f, " "); i = f[3]; h = rh[i]
        if (h != cur) { cur = h; delete slot; nslots = 0 }
        best = -1
        for (x = 0; x < nslots; x++) if (slot[x] <= rs[i] && (best < 0 || slot[x] > slot[best])) best = x
        if (best < 0 && nslots < P) { best = nslots++; slot[best] = rs[i] }
        else { if (best < 0) { best = 0; for (x = 1; x < nslots; x++) if (slot[x] < slot[best]) best = x }
               gaps[ng++] = (rs[i] - slot[best]) / 1e6 }
        slot[best] = re[i]
      }
      sort(gaps, ng)
      nf = 0; for (h in started) { firsts[nf++] = (h in ff) ? (ff[h] - started[h]) / 1e9 : 1e9 }
      sort(firsts, nf)
      mn = -1; mx = 0; for (h in started) { c = count[h] + 0; if (mn < 0 || c < mn) mn = c; if (c > mx) mx = c }
      makespan = (last - first) / 1e9; ideal = N * T / (H * P); eff = makespan > 0 ? 100 * ideal / makespan : 0
      target = "";
      if (H == 1) target = ">= 95% and median gap < 20 ms"
      else if (H == 4 && N == 40 && T == 1) target = ">= 90% and p95 gap < 250 ms"
      else if (H == 4 && T == 5) target = ">= 97%"
      else if (H == 16) target = ">= 95% and p95 gap < 250 ms"
      else if (H == 50) target = ">= 90%"
      else if (H == 100) target = ">= 85%"
      else target = "(quick: proves the benchmark runs)"
      printf "  %d x (%d x %g s, %d proc) %s: %d renders stamped (%d frames)\n", H, N, T, P, mode, n_r, N
      printf "    makespan %.2f s, ideal %.2f s, efficiency %.1f%% (target %s)\n", makespan, ideal, eff, target
      printf "    first frame after start: max %.2f s, median %.2f s (target within 1 s)\n", firsts[nf-1], pct(firsts, nf, 0.5)
      printf "    slot gap over %d renders: median %.1f ms, p95 %.1f ms\n", ng, pct(gaps, ng, 0.5), pct(gaps, ng, 0.95)
      printf "    frames per host: min %d, max %d\n", mn, mx
    }' "$farm/starts" "$farm/stamps"
  # Every frame exactly once: a frame rendered twice or never is a fault of
  # the queue, whatever the figures say.
  local once
  once=$(awk -v N="$frames" '
    { n[$2]++ }
    END { for (f = 1; f <= N; f++) { if (!(f in n)) missing = missing " " f; else if (n[f] > 1) twice = twice " " f "(" n[f] "x)" }
          if (missing != "" || twice != "") printf "%s%s", (missing != "" ? "never rendered:" missing "; " : ""), (twice != "" ? "rendered more than once:" twice : "") }' "$farm/stamps")
  if [ -n "$once" ]; then
    echo "    FAULT: $once"
    failed=1
  fi
  efficiency=$(awk -v H="$hosts" -v N="$frames" -v T="$seconds" -v P="$procs" '
    FNR == NR { if (first == "" || $2 < first) first = $2; next }
    { if ($4 > last) last = $4 }
    END { printf "%.1f", 100 * (N * T / (H * P)) / ((last - first) / 1e9) }' "$farm/starts" "$farm/stamps")
  [ -n "${FARM_BENCH_KEEP:-}" ] || rm -rf "$farm"
  [ "$failed" = 0 ]
}

mkdir -p "$root"
where="the build directory's file system"
if [ "${FARM_BENCH_FS:-}" != build ] && command -v mkfs.ext4 >/dev/null; then
  rm -f "$image"
  if truncate -s 2G "$image" && mkfs.ext4 -q -F "$image" >/dev/null 2>&1 &&
    mount -o loop "$image" "$root" 2>/dev/null; then
    mounted=1
    where="a journaled ext4 file system of its own (loop device)"
  else
    rm -f "$image"
  fi
fi
echo "farm: H daemons (own UTS namespaces) on one control directory, 1 frame a task"
echo "  control directories on $where"
status=0
want_sshfs=0
if [ "${FARM_BENCH_SSHFS:-0}" = 1 ]; then
  if start_sshd; then want_sshfs=1; else echo "  sshfs runs skipped: sshfs, sshd or /dev/fuse missing"; fi
fi
for s in $settings; do
  IFS=: read -r h n t p <<<"$s"
  run_setting "$h" "$n" "$t" "$p" local || status=1
  local_eff=$efficiency
  if [ "$want_sshfs" = 1 ] && [ "$h" = 4 ]; then
    run_setting "$h" "$n" "$t" "$p" sshfs || status=1
    echo "    efficiency local $local_eff% vs sshfs $efficiency%"
  fi
done
exit $status
