#!/usr/bin/env bash
# Installs the Debian packages the build and the tests need, when run as root
# with apt; otherwise names the missing ones and fails.
set -u
need=()
have_cmd() { command -v "$1" >/dev/null 2>&1; }
have_pkg() { dpkg -s "$1" >/dev/null 2>&1; }
have_cmd cmake || need+=(cmake)
have_cmd g++ || need+=(g++)
have_cmd make || need+=(make)
have_cmd flex || need+=(flex)
have_cmd bison || need+=(bison)
have_cmd faketime || need+=(faketime)
have_cmd ps || need+=(procps)
have_cmd unshare || need+=(util-linux)
# Network-mount variants of the farm tests: each host mounts the control
# directory over sshfs from an sshd on the loopback.
have_cmd sshfs || need+=(sshfs)
[ -x /usr/sbin/sshd ] || need+=(openssh-server)
have_pkg libgtest-dev || need+=(libgtest-dev)
have_pkg libgmock-dev || need+=(libgmock-dev)
have_pkg libbenchmark-dev || need+=(libbenchmark-dev)
# The queue command-line tool: options, JSON output, its status page server.
have_pkg libcli11-dev || need+=(libcli11-dev)
have_pkg nlohmann-json3-dev || need+=(nlohmann-json3-dev)
have_pkg libcpp-httplib-dev || need+=(libcpp-httplib-dev)
# What only the tests drive (large: asked for by `make test`, not by the
# demo): the real renderers behind the wrappers, the terminal the tool's
# live view is tested in, the browser its status page is tested in.
if [ "${RJ_WITH_RENDERERS:-0}" = 1 ]; then
  have_cmd blender || need+=(blender)
  have_cmd povray || need+=(povray)
  have_cmd tmux || need+=(tmux)
  have_cmd chromium || need+=(chromium)
fi
if [ "${RJ_NEED_CLANG:-0}" = 1 ]; then
  have_cmd clang++ || need+=(clang)
  have_pkg libclang-rt-dev || have_pkg libclang-rt-14-dev || need+=(libclang-rt-dev)
fi
[ ${#need[@]} -eq 0 ] && exit 0
if [ "$(id -u)" = 0 ] && have_cmd apt-get; then
  echo "installing: ${need[*]}"
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq >/dev/null && apt-get install -y -qq "${need[@]}" >/dev/null && exit 0
  echo "apt-get could not install: ${need[*]}" >&2
  exit 1
fi
echo "missing Debian packages: ${need[*]} (install them as root: apt-get install ${need[*]})" >&2
exit 1
