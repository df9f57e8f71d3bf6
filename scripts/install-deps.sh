#!/usr/bin/env bash
# Installs the Debian packages the project needs to build and test, only
# those that are missing. Debian 12; run as root (or with sudo available).
set -euo pipefail

packages=(
  build-essential cmake pkg-config git
  libjsoncpp-dev
  googletest libgtest-dev libgmock-dev libbenchmark-dev
  clang-format
  iproute2 util-linux
  libminiupnpc-dev libnatpmp-dev miniupnpc natpmpc
  miniupnpd-nftables nftables
  libcpp-httplib-dev libcrypt-dev
)

missing=()
for package in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$package" 2>/dev/null |
      grep -q 'install ok installed'; then
    missing+=("$package")
  fi
done

if [ ${#missing[@]} -eq 0 ]; then
  exit 0
fi

sudo_cmd=()
if [ "$(id -u)" -ne 0 ]; then
  sudo_cmd=(sudo)
fi
echo "installing: ${missing[*]}"
"${sudo_cmd[@]}" env DEBIAN_FRONTEND=noninteractive apt-get update -qq
"${sudo_cmd[@]}" env DEBIAN_FRONTEND=noninteractive \
  apt-get install -y -qq --no-install-recommends "${missing[@]}"
