#!/usr/bin/env bash
# Builds the Debian package of a build folder and checks it without
# installing it: every program, library, unit and data file at its path,
# the libraries' RPATH, and the dependencies.
#
#   packaging/check-deb.sh BUILD [OUTPUT-FOLDER]
#
# The build must be configured with -DCMAKE_INSTALL_PREFIX=/usr and www/dist
# must be built. The package is left in OUTPUT-FOLDER when one is given;
# otherwise it is made in a temporary folder inside BUILD and removed.
set -euo pipefail

build=$(realpath "${1:?usage: check-deb.sh BUILD [OUTPUT-FOLDER]}")
prefix=$(sed -n 's/^CMAKE_INSTALL_PREFIX:PATH=//p' "$build/CMakeCache.txt")
if [ "$prefix" != /usr ]; then
  echo "check-deb: $build is configured with CMAKE_INSTALL_PREFIX=$prefix, not /usr" >&2
  exit 1
fi
libdir=$(sed -n 's/^CMAKE_INSTALL_LIBDIR:PATH=//p' "$build/CMakeCache.txt")

if [ $# -ge 2 ]; then
  out=$(realpath -m "$2")
  mkdir -p "$out"
  keep=1
else
  out=$(mktemp -d "$build/deb.XXXXXX")
  keep=0
fi
cleanup() { [ "$keep" = 1 ] || rm -rf "$out"; }
trap cleanup EXIT

(cd "$build" && cpack -G DEB -B "$out" >"$out/cpack.log" 2>&1) || {
  cat "$out/cpack.log" >&2
  echo "check-deb: cpack failed" >&2
  exit 1
}
deb=$(find "$out" -maxdepth 1 -name '*.deb' | head -n 1)
[ -n "$deb" ] || {
  echo "check-deb: cpack made no .deb" >&2
  exit 1
}

listing=$(dpkg-deb -c "$deb" | sed -e 's/^.* \.\//\//' -e 's/ -> .*//')
failures=0
expect() {
  if ! grep -qxF -- "$1" <<<"$listing"; then
    echo "check-deb: missing $1" >&2
    failures=$((failures + 1))
  fi
}
expect "/usr/sbin/zark-webapid"
expect "/usr/lib/systemd/system/zark-webapid.service"
expect "/usr/$libdir/zark/libzarkklibc.so"
expect "/usr/$libdir/zark/libzarkwebapi.so"
expect "/usr/$libdir/zark/libzarkportmap.so"
expect "/usr/$libdir/zark/libzarkfirewall.so"
expect "/usr/$libdir/zark/modules/ZARK.Core.PortForwarding.so"
expect "/usr/$libdir/zark/modules/ZARK.Core.PortForwarding.Status.so"
expect "/usr/share/zark/www/index.html"
expect "/usr/zark/bin/zarkportforward"
expect "/usr/zark/etc.defaults/firewall_service_mapping_table"
expect "/usr/zark/etc.defaults/services.d/ssh.sc"
expect "/etc.defaults/portforward/routerdb/routerdb.conf"
expect "/etc/zark/"
expect "/usr/bin/zark-probed"

# Every shipped program and library finds the project's libraries.
extract="$out/extract"
mkdir -p "$extract"
dpkg-deb -x "$deb" "$extract"
for elf in usr/sbin/zark-webapid usr/bin/zark-probed usr/zark/bin/zarkportforward \
  "usr/$libdir/zark/modules/ZARK.Core.PortForwarding.so" \
  "usr/$libdir/zark/modules/ZARK.Core.PortForwarding.Status.so" \
  "usr/$libdir/zark/libzarkportmap.so"; do
  runpath=$(objdump -p "$extract/$elf" | awk '$1 == "RUNPATH" || $1 == "RPATH" { print $2 }')
  if [ "$runpath" != "/usr/$libdir/zark" ]; then
    echo "check-deb: /$elf has RUNPATH \"$runpath\", not /usr/$libdir/zark" >&2
    failures=$((failures + 1))
  fi
done

# The host's unit starts it with the folders the package fills (they come
# from the configure-time prefix, as do the host's built-in defaults).
unit="$extract/usr/lib/systemd/system/zark-webapid.service"
read -r -a exec_start < <(sed -n 's/^ExecStart=//p' "$unit")
unit_check() {
  if ! [ -e "$extract$2" ]; then
    echo "check-deb: zark-webapid.service: $1 $2 is not in the package" >&2
    failures=$((failures + 1))
  fi
}
unit_check program "${exec_start[0]}"
for ((i = 1; i + 1 < ${#exec_start[@]}; i++)); do
  case "${exec_start[i]}" in
  --modules) unit_check --modules "${exec_start[i + 1]}/ZARK.Core.PortForwarding.so" ;;
  --www) unit_check --www "${exec_start[i + 1]}/index.html" ;;
  --accounts) unit_check "--accounts folder" "$(dirname "${exec_start[i + 1]}")" ;;
  esac
done

# Renewal is on after install: the maintainer scripts enable and start the
# host, whose status module runs the keeper; no second renewer (a timer).
control="$out/control"
mkdir -p "$control"
dpkg-deb -e "$deb" "$control"
for script in postinst prerm postrm; do
  if ! [ -x "$control/$script" ]; then
    echo "check-deb: the package has no executable $script" >&2
    failures=$((failures + 1))
  fi
done
if ! grep -q 'systemctl enable zark-webapid.service' "$control/postinst" 2>/dev/null; then
  echo "check-deb: postinst does not enable zark-webapid.service" >&2
  failures=$((failures + 1))
fi
if ! grep -q 'disable --now zark-webapid.service' "$control/prerm" 2>/dev/null; then
  echo "check-deb: prerm does not stop zark-webapid.service" >&2
  failures=$((failures + 1))
fi
if grep -q 'zarkportforward-renew' <<<"$listing"; then
  echo "check-deb: the package still ships a renewal timer besides the keeper" >&2
  failures=$((failures + 1))
fi

depends=$(dpkg-deb -f "$deb" Depends)
for package in libjsoncpp25 libminiupnpc17 libnatpmp1 libcpp-httplib0.11 libcrypt1 \
  libexpat1 libc-ares2 libarchive13; do
  if ! grep -q "\b$package\b" <<<"$depends"; then
    echo "check-deb: Depends lacks $package: $depends" >&2
    failures=$((failures + 1))
  fi
done

if [ "$failures" -ne 0 ]; then
  echo "check-deb: $deb: $failures problems" >&2
  exit 1
fi
echo "check-deb: $(basename "$deb"): $(grep -c . <<<"$listing") entries, all at their paths"
