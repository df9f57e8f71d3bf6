# shellcheck shell=bash disable=SC2154,SC2034 # root comes from the caller;
# listen, address, state, build and password_file go back to it.
# What the main job (scripts/run.sh) and the demo (scripts/demo.sh) share:
# their command line, and preparing the state folder (installing what is
# missing, building, installing the build into the state folder). Sourced,
# not run; the caller sets root (the repository).

jobs=${JOBS:-$(nproc)}
# shellcheck source=scripts/builds.sh
. "$root/scripts/builds.sh"

# parse_main_job_args NAME DEFAULT_STATE [ARGUMENT...]
# Reads ZARK_LISTEN, ZARK_STATE_DIR and ZARK_BUILD_DIR, then the command
# line (--listen ADDRESS:PORT, --help), and sets listen, address, port,
# state and build. NAME is the script's name for messages; --help prints
# the calling script's header comment.
parse_main_job_args() {
  local name=$1
  listen=${ZARK_LISTEN:-127.0.0.1:5000}
  state=${ZARK_STATE_DIR:-$2}
  build=${ZARK_BUILD_DIR:-$root/build}
  shift 2
  while [ $# -gt 0 ]; do
    case "$1" in
    --listen)
      [ $# -ge 2 ] || {
        echo "$name: --listen takes ADDRESS:PORT" >&2
        exit 2
      }
      listen=$2
      shift 2
      ;;
    --listen=*)
      listen=${1#--listen=}
      shift
      ;;
    -h | --help)
      awk 'NR > 1 && /^#/ { sub(/^# ?/, ""); print; next } NR > 1 { exit }' "$0"
      exit 0
      ;;
    *)
      echo "$name: unknown argument $1 (see --help)" >&2
      exit 2
      ;;
    esac
  done
  address=${listen%:*}
  port=${listen##*:}
  if ! [[ "$port" =~ ^[0-9]+$ ]]; then
    echo "$name: --listen takes ADDRESS:PORT, for example 127.0.0.1:5000" >&2
    exit 2
  fi
}

# True when something listens on TCP port $port of this machine.
port_in_use() { [ -n "$(ss -Hltn "sport = :$port" 2>/dev/null)" ]; }

# Installs what is missing, builds the programs and the browser front end
# in $build, installs them into $state (made absolute) and makes the
# account "admin" on the first run. Sets password_file (the file with its
# password, while it is the first one).
prepare_main_job() {
  "$root/scripts/install-deps.sh"

  echo "== building (in $build)"
  build_installed "$build"

  echo "== building the browser front end (www/dist)"
  (
    cd "$root/www" || exit 1
    # npm ci starts from scratch; only when the locked list changed.
    if [ ! -f node_modules/.package-lock.json ] ||
      [ package-lock.json -nt node_modules/.package-lock.json ]; then
      npm ci --no-audit --no-fund
    fi
    npm run build --silent
  )

  mkdir -p "$state"
  state=$(realpath "$state")
  build=$(realpath "$build")
  echo "== installing into $state"
  bash "$root/packaging/sandbox.sh" stage "$build" "$state"
  password_file=$(bash "$root/packaging/sandbox.sh" account "$build" "$state" admin)
}
