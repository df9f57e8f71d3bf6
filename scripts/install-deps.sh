#!/usr/bin/env bash
# Installs the Debian packages the project needs to build, run and test,
# only those that are missing. Debian 12; run as root (or with sudo
# available).
#
#   install-deps.sh          building, the main job and the demo
#   install-deps.sh --e2e    also the browser of the end-to-end tests
#   install-deps.sh --hardening
#                            also clang with its sanitizer and libFuzzer
#                            runtimes, clang-tidy and cppcheck
#
# The browser front end needs Node.js >= 20.19 with npm. Debian 12's own
# nodejs is 18, too old for the locked build tools: where node is missing it
# is installed from Debian all the same, and the version check below says
# how to get a newer one.
#
# A caller that ran it already in this run exports ZARK_DEPS_INSTALLED with
# the options it gave ("base --e2e --hardening"; scripts/builds.sh's
# install_deps_once): when those include the ones asked for, nothing is
# checked again.
set -euo pipefail

readonly NODE_MIN=20.19

packages=(
  build-essential cmake ninja-build pkg-config git
  libjsoncpp-dev
  googletest libgtest-dev libgmock-dev libbenchmark-dev
  clang-format
  iproute2 util-linux
  libminiupnpc-dev libnatpmp-dev miniupnpc natpmpc
  miniupnpd-nftables nftables
  libcpp-httplib-dev libcrypt-dev
  libexpat1-dev libc-ares-dev libarchive-dev
  # demo and end-to-end tests: the relay from the machine into the test
  # network, and the test network's name server
  socat dnsmasq-base
)

for arg in "$@"; do
  case "$arg" in
  --e2e) packages+=(chromium) ;;
  --hardening) packages+=(clang libclang-rt-14-dev clang-tidy cppcheck) ;;
  *)
    echo "usage: $0 [--e2e] [--hardening]" >&2
    exit 2
    ;;
  esac
done

if [ -n "${ZARK_DEPS_INSTALLED:-}" ]; then
  covered=1
  for arg in "$@"; do
    case " $ZARK_DEPS_INSTALLED " in
    *" $arg "*) ;;
    *) covered=0 ;;
    esac
  done
  if [ "$covered" = 1 ]; then
    exit 0
  fi
fi

missing=()
for package in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$package" 2>/dev/null |
    grep -q 'install ok installed'; then
    missing+=("$package")
  fi
done
# Node.js and npm count as present when their commands are, whatever
# package brought them (NodeSource's nodejs carries npm and conflicts with
# Debian's npm).
command -v node >/dev/null || missing+=(nodejs)
command -v npm >/dev/null || missing+=(npm)

if [ ${#missing[@]} -gt 0 ]; then
  sudo_cmd=()
  if [ "$(id -u)" -ne 0 ]; then
    sudo_cmd=(sudo)
  fi
  echo "installing: ${missing[*]}"
  "${sudo_cmd[@]}" env DEBIAN_FRONTEND=noninteractive apt-get update -qq
  "${sudo_cmd[@]}" env DEBIAN_FRONTEND=noninteractive \
    apt-get install -y -qq --no-install-recommends "${missing[@]}"
fi

# The front end's build tools (vite, vitest) need Node.js >= 20.19.
node_version=$(node --version 2>/dev/null || echo none)
if ! node -e '
  const [maj, min] = process.versions.node.split(".").map(Number);
  const [wmaj, wmin] = process.argv[1].split(".").map(Number);
  process.exit(maj > wmaj || (maj === wmaj && min >= wmin) ? 0 : 1);
' "$NODE_MIN" 2>/dev/null; then
  cat >&2 <<EOF
install-deps: Node.js $node_version is too old: the browser front end
(www/) is built with tools that need Node.js >= $NODE_MIN.
Debian 12's own nodejs package is 18. Install a newer Node.js, for
example from NodeSource's Debian repository (its "nodejs" package for
Node 20 or 22 brings npm with it; remove Debian's npm first) or from an
official nodejs.org binary tarball with its bin/ folder first in PATH,
then run the command again.
EOF
  exit 1
fi
