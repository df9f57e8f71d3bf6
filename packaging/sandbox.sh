#!/usr/bin/env bash
# Runs an installation of the project without installing it on the machine:
# `cmake --install` into a state folder, and programs started in a private
# mount namespace in which the state folder's files appear at the fixed
# paths the programs use. Nothing is written outside the state folder (but
# for an empty /etc.defaults, the mount point, where the machine lacks one).
#
#   sandbox.sh stage BUILD STATE
#     installs the build (and www/dist) into STATE/root (DESTDIR staging).
#     The build must be configured with CMAKE_INSTALL_PREFIX /usr or a
#     folder under /usr.
#   sandbox.sh account BUILD STATE USER
#     makes sure the accounts file STATE/etc/zark/webapid.accounts (mode
#     0600) has USER; a new USER gets a random password, kept in
#     STATE/etc/zark/USER.password (0600). Prints the password file's path.
#   sandbox.sh exec STATE COMMAND [ARGS...]
#     runs COMMAND in the namespace.
#   sandbox.sh host STATE [ZARK-WEBAPID OPTIONS...]
#     runs the installed zark-webapid in the namespace with the installed
#     module folder, front end and the accounts file of the state folder.
#
# Inside the namespace:
#
#   /usr                        the machine's /usr with STATE/root/usr laid
#                               over it (host, libraries, module, front end,
#                               /usr/zark); writes stay in memory
#   /etc                        the machine's /etc; writes stay in memory
#   /etc/portforward            STATE/etc/portforward (rules, router
#                               configuration, portmap.conf) - kept
#   /etc/zark                   STATE/etc/zark (accounts file) - kept
#   /usr/local/etc/services.d   STATE/services.d (package services) - kept
#   /etc.defaults               STATE/root/etc.defaults (router database) -
#                               kept; the next stage refreshes shipped files
#   /etc/resolv.conf            STATE/resolv.conf where there is one (the
#                               test network's name server), else the
#                               machine's
#   /dev                        the machine's devices, and /dev/log, the
#                               sandbox's syslog: STATE/logs/syslog.log
#   /tmp                        a fresh tmpfs
#
# The namespace ends with its last process; there is nothing to undo.
# Needs root.
set -euo pipefail

die() {
  echo "sandbox: $*" >&2
  exit 1
}

# Overlay options cannot hold these characters in a folder name.
check_path() {
  case "$1" in
  *[,:]* | *[[:space:]]*) die "$1: the state folder's path may not hold ',', ':' or blanks" ;;
  esac
}

stage() {
  local build=$1 state=$2 prefix
  [ -f "$build/CMakeCache.txt" ] || die "$build is not a configured build folder"
  prefix=$(sed -n 's/^CMAKE_INSTALL_PREFIX:PATH=//p' "$build/CMakeCache.txt")
  case "$prefix" in
  /usr | /usr/*) ;;
  *) die "$build is configured with CMAKE_INSTALL_PREFIX=$prefix; the sandbox needs /usr (cmake -DCMAKE_INSTALL_PREFIX=/usr $build)" ;;
  esac
  mkdir -p "$state/root"
  # Only files that changed are copied; the rest stays as it is.
  DESTDIR="$state/root" cmake --install "$build" >"$state/install.log" ||
    die "cmake --install failed; see $state/install.log"

  # Where the host, its module and the front end went, from the list of
  # installed files.
  local manifest="$build/install_manifest.txt" bin module www
  bin=$(sed -n 's|^\(/.*/sbin/zark-webapid\)$|\1|p' "$manifest" | head -n 1)
  module=$(sed -n 's|^\(/.*\)/ZARK\.Core\.PortForwarding\.so$|\1|p' "$manifest" | head -n 1)
  www=$(sed -n 's|^\(/.*/zark/www\)/index\.html$|\1|p' "$manifest" | head -n 1)
  if [ -z "$bin" ] || [ -z "$module" ] || [ -z "$www" ]; then
    die "the installation lacks the host, the module or the front end (see $manifest)"
  fi
  # The status module runs the keeper (lease renewal, lost mappings
  # restored): without it nothing renews the router's mappings.
  grep -q '/ZARK\.Core\.PortForwarding\.Status\.so$' "$manifest" ||
    die "the installation lacks the status module ZARK.Core.PortForwarding.Status.so (the renewal service; see $manifest)"
  local path
  for path in "$bin" "$module" "$www"; do
    case "$path" in
    /usr/*) ;;
    *) die "$path is not under /usr" ;;
    esac
  done
  printf 'bin=%s\nmodules=%s\nwww=%s\n' "$bin" "$module" "$www" >"$state/host.conf"
}

account() {
  local build=$1 state=$2 user=$3
  local folder="$state/etc/zark"
  local accounts="$folder/webapid.accounts"
  local password_file="$folder/$user.password"
  mkdir -p "$folder"
  chmod 0700 "$folder"
  if [ -f "$accounts" ] && awk -F: -v u="$user" '$1 == u { found = 1 } END { exit !found }' "$accounts"; then
    echo "$password_file"
    return 0
  fi
  local password
  # 18 random bytes: 24 characters of base64 with no '+' or '/'.
  password=$(head -c 18 /dev/urandom | base64 | tr '+/' '-_')
  (
    umask 077
    printf '%s\n' "$password" >"$password_file"
  )
  printf '%s\n' "$password" |
    "$build/bin/zark-webapid" passwd "$user" --accounts "$accounts" >/dev/null ||
    die "zark-webapid passwd $user failed"
  chmod 0600 "$accounts"
  echo "$password_file"
}

# The namespace's mounts; runs as the first process of the new namespace.
# After the fresh /tmp nothing refers to STATE any more, so a state folder
# under /tmp works as well.
enter() {
  local state=$1
  shift
  local root="$state/root" scratch="$state/.mounts"
  [ -d "$root/usr" ] || die "$root/usr is missing: stage the build first"

  # Upper layers of the overlays live in memory, on a tmpfs of their own.
  mount -t tmpfs -o mode=0700 zark-sandbox "$scratch"
  mkdir -p "$scratch"/usr/{upper,work} "$scratch"/etc/{upper,work}
  mount -t overlay zark-sandbox -o "lowerdir=$root/usr:/usr,upperdir=$scratch/usr/upper,workdir=$scratch/usr/work" /usr
  mount -t overlay zark-sandbox -o "lowerdir=/etc,upperdir=$scratch/etc/upper,workdir=$scratch/etc/work" /etc

  if [ -f "$state/resolv.conf" ]; then
    # Replaces the file or symbolic link in the overlay only.
    rm -f /etc/resolv.conf
    cp "$state/resolv.conf" /etc/resolv.conf
  fi
  mkdir -p /etc/portforward /etc/zark /usr/local/etc/services.d
  mount --bind "$state/etc/portforward" /etc/portforward
  mount --bind "$state/etc/zark" /etc/zark
  mount --bind "$state/services.d" /usr/local/etc/services.d
  mount --bind "$root/etc.defaults" /etc.defaults

  private_dev
  # The syslog of the namespace: runs until this process (the command
  # below, after exec) has ended.
  mkdir -p "$state/logs"
  perl "$(dirname "$(realpath "$0")")/sandbox-syslog.pl" /dev/log $$ \
    >>"$state/logs/syslog.log" 2>&1 </dev/null &
  local i
  for ((i = 0; i < 200; i++)); do
    [ -S /dev/log ] && break
    sleep 0.01
  done
  [ -S /dev/log ] || die "the sandbox's syslog did not start (see $state/logs/syslog.log)"

  mount -t tmpfs -o mode=1777 zark-sandbox /tmp
  cd /
  exec "$@"
}

# A /dev of the namespace's own, so that /dev/log can be a socket of the
# sandbox whether or not the machine runs a syslog daemon: a tmpfs with the
# machine's /dev under /dev/.machine and a symbolic link to each of its
# entries (symbolic links as they are).
private_dev() {
  local scratch="$state/.mounts" entry name
  mkdir -p "$scratch/dev"
  mount --rbind /dev "$scratch/dev"
  mount -t tmpfs -o mode=0755 zark-sandbox /dev
  mkdir /dev/.machine
  mount --move "$scratch/dev" /dev/.machine
  for entry in /dev/.machine/* /dev/.machine/.[!.]*; do
    [ -e "$entry" ] || [ -L "$entry" ] || continue
    name=${entry##*/}
    if [ -L "$entry" ]; then
      cp -P "$entry" "/dev/$name"
    elif [ "$name" != log ]; then
      ln -s ".machine/$name" "/dev/$name"
    fi
  done
}

command=${1:-}
shift || true
case "$command" in
stage)
  [ $# -eq 2 ] || die "usage: sandbox.sh stage BUILD STATE"
  stage "$(realpath "$1")" "$(realpath -m "$2")"
  ;;
account)
  [ $# -eq 3 ] || die "usage: sandbox.sh account BUILD STATE USER"
  account "$(realpath "$1")" "$(realpath -m "$2")" "$3"
  ;;
exec)
  [ $# -ge 2 ] || die "usage: sandbox.sh exec STATE COMMAND [ARGS...]"
  [ "$(id -u)" -eq 0 ] || die "needs root (mount namespaces)"
  state=$(realpath "$1")
  shift
  check_path "$state"
  mkdir -p "$state/etc/portforward" "$state/etc/zark" "$state/services.d" \
    "$state/.mounts" "$state/root/etc.defaults"
  # The mount point of /etc.defaults; its parent is / so no overlay can
  # provide it. Left behind empty where the machine had none.
  [ -d /etc.defaults ] || mkdir -m 0755 /etc.defaults
  exec unshare --mount --propagation private \
    bash "$(realpath "$0")" __enter "$state" "$@"
  ;;
host)
  [ $# -ge 1 ] || die "usage: sandbox.sh host STATE [OPTIONS...]"
  state=$(realpath "$1")
  shift
  [ -f "$state/host.conf" ] || die "$state/host.conf is missing: stage the build first"
  bin=$(sed -n 's/^bin=//p' "$state/host.conf")
  modules=$(sed -n 's/^modules=//p' "$state/host.conf")
  www=$(sed -n 's/^www=//p' "$state/host.conf")
  # ZARK_KEEPER_INTERVAL: how often the keeper checks the router for lost
  # mappings (seconds; the host's default is 300).
  keeper=()
  if [ -n "${ZARK_KEEPER_INTERVAL:-}" ]; then
    keeper=(--keeper-interval "$ZARK_KEEPER_INTERVAL")
  fi
  exec bash "$(realpath "$0")" exec "$state" "$bin" --modules "$modules" \
    --www "$www" --accounts /etc/zark/webapid.accounts "${keeper[@]}" "$@"
  ;;
__enter)
  enter "$@"
  ;;
*)
  die "usage: sandbox.sh stage BUILD STATE | account BUILD STATE USER | exec STATE COMMAND [ARGS...] | host STATE [OPTIONS...]"
  ;;
esac
