#!/usr/bin/env bash
# The main job: installs what is missing, builds the programs and the
# browser front end, and starts the web API host zark-webapid with the
# module on 127.0.0.1:5000, serving the front end. Run as root.
#
#   bash scripts/run.sh [--listen ADDRESS:PORT]
#
# Environment:
#   ZARK_LISTEN      address and port to listen on (default 127.0.0.1:5000;
#                    --listen wins)
#   ZARK_STATE_DIR   the state folder (default ./state of the repository)
#   ZARK_BUILD_DIR   the build folder (default ./build of the repository)
#
# Nothing is installed on the machine: the build is installed into the state
# folder, and the host runs in a private mount namespace in which that
# installation and the state folder appear at the fixed paths
# (packaging/sandbox.sh). The first run makes the account "admin" with a
# random password, kept in the state folder. The host's syslog lines go to
# STATE/logs/syslog.log. Ctrl-C stops the host.
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
listen=${ZARK_LISTEN:-127.0.0.1:5000}
state=${ZARK_STATE_DIR:-$root/state}
build=${ZARK_BUILD_DIR:-$root/build}

while [ $# -gt 0 ]; do
  case "$1" in
  --listen)
    [ $# -ge 2 ] || {
      echo "run.sh: --listen takes ADDRESS:PORT" >&2
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
    echo "run.sh: unknown argument $1 (see --help)" >&2
    exit 2
    ;;
  esac
done

if [ "$(id -u)" -ne 0 ]; then
  echo "run.sh: run it as root: the host runs in a private mount namespace" >&2
  exit 1
fi

port=${listen##*:}
if ! [[ "$port" =~ ^[0-9]+$ ]]; then
  echo "run.sh: --listen takes ADDRESS:PORT, for example 127.0.0.1:5000" >&2
  exit 2
fi

port_in_use() { [ -n "$(ss -Hltn "sport = :$port" 2>/dev/null)" ]; }
if [ "${ZARK_RUN_PREPARE_ONLY:-}" != 1 ] && port_in_use; then
  echo "run.sh: something listens on port $port already; stop it, or choose another port: bash scripts/run.sh --listen 127.0.0.1:5001" >&2
  exit 1
fi

"$root/scripts/install-deps.sh"

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

echo "== building (in $build)"
# Installed as a system would be (prefix /usr): the host's default folders
# and the libraries' RPATH are then the ones of the Debian package.
mapfile -t reset < <(forget_other_prefix "$build")
cmake -S "$root" -B "$build" -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DCMAKE_INSTALL_PREFIX=/usr "${reset[@]}" >/dev/null
# Every target with an install rule.
cmake --build "$build" -j "${JOBS:-$(nproc)}" --target \
  zark_klibc zark_webapi zark_portmap zark_firewall zark_module \
  zarkportforward zark-webapid zark_probed

echo "== building the browser front end (www/dist)"
(
  cd "$root/www"
  # npm ci starts from scratch; only when the locked list changed.
  if [ ! -f node_modules/.package-lock.json ] ||
    [ package-lock.json -nt node_modules/.package-lock.json ]; then
    npm ci --no-audit --no-fund
  fi
  npm run build --silent
)

mkdir -p "$state"
state=$(realpath "$state")
echo "== installing into $state"
bash "$root/packaging/sandbox.sh" stage "$build" "$state"
password_file=$(bash "$root/packaging/sandbox.sh" account "$build" "$state" admin)
# scripts/demo.sh prepares with this script and starts the host itself.
if [ "${ZARK_RUN_PREPARE_ONLY:-}" = 1 ]; then
  exit 0
fi

if port_in_use; then
  echo "run.sh: something listens on port $port already:" >&2
  ss -Hltnp "sport = :$port" >&2 || true
  echo "run.sh: stop it, or choose another port: bash scripts/run.sh --listen 127.0.0.1:5001" >&2
  exit 1
fi

host=${listen%:*}
host=${host#[}
host=${host%]}
case "$host" in
0.0.0.0 | '::') url_host=127.0.0.1 ;;
*:*) url_host="[$host]" ;;
*) url_host=$host ;;
esac

cat <<EOF

zark-webapid serves the module and the browser front end at

    http://$url_host:$port/

  account:   admin
EOF
if [ -f "$password_file" ]; then
  echo "  password:  $(cat "$password_file")   (kept in $password_file)"
else
  echo "  password:  the one set with zark-webapid passwd ($state/etc/zark/webapid.accounts)"
fi
cat <<EOF
  state:     $state (rules, router configuration, accounts)
EOF
cat <<EOF
  logs:      $state/logs/syslog.log (the host's syslog lines)
EOF
echo
echo "Ctrl-C stops it."

# In the background so that this shell stays in charge: Ctrl-C and SIGTERM
# are passed on, and the host's end is reported.
bash "$root/packaging/sandbox.sh" host "$state" --listen "$listen" &
pid=$!
stop() { kill -TERM "$pid" 2>/dev/null || true; }
trap stop INT TERM HUP
# A wait that a signal interrupts returns early: wait again until the host
# has ended, then once more for its own exit status.
while kill -0 "$pid" 2>/dev/null; do
  wait "$pid" || true
done
status=0
wait "$pid" || status=$?
trap - INT TERM HUP
if [ "$status" -ne 0 ]; then
  echo "run.sh: zark-webapid ended with status $status; see $state/logs/syslog.log" >&2
  exit "$status"
fi
echo "zark-webapid stopped."
