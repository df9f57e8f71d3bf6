# shellcheck shell=bash
# The build folders of the test command (scripts/test.sh), the figures
# command (scripts/figures.sh), the main job (scripts/run.sh) and the demo
# (scripts/demo.sh), configured the same way by all. Sourced, not run; the
# caller sets root (the repository) and jobs.
#
#   build        plain RelWithDebInfo build, install prefix /usr (the main
#                job, the package and the end-to-end test use it)
#   build-asan   Debug build under AddressSanitizer (with LeakSanitizer) and
#                UndefinedBehaviorSanitizer

# New build folders use Ninja, once installed: it schedules the whole
# tree's compiles across targets and starts faster than make. Folders
# configured before keep their generator.
use_ninja() {
  if [ -z "${CMAKE_GENERATOR:-}" ] && command -v ninja >/dev/null; then
    export CMAKE_GENERATOR=Ninja
  fi
}
use_ninja

# Options of the sanitizer runs: a leak, an address error or undefined
# behaviour ends the test process with an error.
export ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1:abort_on_error=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}

# A build folder configured before with another install prefix keeps the
# host's default folders of that prefix in its cache: the options that make
# CMake compute them again from /usr.
forget_other_prefix() {
  local cached
  cached=$(sed -n 's/^CMAKE_INSTALL_PREFIX:PATH=//p' "$1/CMakeCache.txt" 2>/dev/null || true)
  if [ -n "$cached" ] && [ "$cached" != /usr ]; then
    printf '%s\n' '-UZARK_WEBAPID_*' -UZARK_SYSTEMD_UNITDIR
  fi
}

# Configures and builds folder BUILD with the given CMake options.
build_folder() {
  local build=$1
  shift
  cmake -S "$root" -B "$build" "$@" >/dev/null
  cmake --build "$build" -j "$jobs"
}

# Configures folder BUILD as the plain build: installed as a system would be
# (prefix /usr), so that the host's default folders and the libraries'
# RPATH are the ones of the Debian package.
configure_plain() {
  local reset
  mapfile -t reset < <(forget_other_prefix "$1")
  cmake -S "$root" -B "$1" -DCMAKE_BUILD_TYPE=RelWithDebInfo \
    -DCMAKE_INSTALL_PREFIX=/usr "${reset[@]}" >/dev/null
}

build_plain() {
  configure_plain "$root/build"
  cmake --build "$root/build" -j "$jobs"
}

# Builds in folder BUILD (plain) what the main job installs: every target
# with an install rule.
build_installed() {
  configure_plain "$1"
  cmake --build "$1" -j "$jobs" --target \
    zark_klibc zark_webapi zark_portmap zark_firewall zark_module \
    zark_status_module zarkportforward zark-webapid zark_probed
}

# Runs scripts/install-deps.sh with the given options once for the whole
# run: the scripts called afterwards (scripts/tsan.sh, fuzz.sh, analyze.sh)
# find ZARK_DEPS_INSTALLED and do not check again.
install_deps_once() {
  "$root/scripts/install-deps.sh" "$@"
  export ZARK_DEPS_INSTALLED="base $*"
  use_ninja
}

build_asan() {
  # The benchmarks are measured in the plain build only.
  build_folder "$root/build-asan" -DCMAKE_BUILD_TYPE=Debug \
    -DZARK_SANITIZE=address,undefined -DZARK_BUILD_BENCH=OFF
}
