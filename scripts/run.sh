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
#   ZARK_KEEPER_INTERVAL  how often the host's keeper checks the router for
#                    lost mappings, in seconds (default 300)
#
# Nothing is installed on the machine: the build is installed into the state
# folder, and the host runs in a private mount namespace in which that
# installation and the state folder appear at the fixed paths
# (packaging/sandbox.sh). The first run makes the account "admin" with a
# random password, kept in the state folder. The host's syslog lines go to
# STATE/logs/syslog.log. Ctrl-C stops the host.
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
# shellcheck source=scripts/main-job.sh
. "$root/scripts/main-job.sh"
parse_main_job_args run.sh "$root/state" "$@"

if [ "$(id -u)" -ne 0 ]; then
  echo "run.sh: run it as root: the host runs in a private mount namespace" >&2
  exit 1
fi

if port_in_use; then
  echo "run.sh: something listens on port $port already; stop it, or choose another port: bash scripts/run.sh --listen 127.0.0.1:5001" >&2
  exit 1
fi

prepare_main_job

if port_in_use; then
  echo "run.sh: something listens on port $port already:" >&2
  ss -Hltnp "sport = :$port" >&2 || true
  echo "run.sh: stop it, or choose another port: bash scripts/run.sh --listen 127.0.0.1:5001" >&2
  exit 1
fi

host=${address#[}
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
  renewal:   the keeper in zark-webapid renews leases at half their time and
             checks the router every ${ZARK_KEEPER_INTERVAL:-300} s (ZARK_KEEPER_INTERVAL)
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
