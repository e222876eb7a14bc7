#!/usr/bin/env bash
# Unpacks the Debian 12 libraries that keymgr builds and runs against, for a
# target architecture, into a sysroot folder:
#   cross-sysroot.sh arm64|armhf DIR
# The packages come from the machine's own Debian sources, read through a
# private apt state (scripts/target-apt.sh), so the machine's package
# database is left alone (no dpkg --add-architecture). The sysroot holds the
# target's own loader and C library: the emulator takes DIR as its library
# prefix, and a program never runs on a mix of the cross compiler's C library
# and another version of it.
# DIR/var/lib/dpkg is the sysroot's own dpkg database, which dpkg-shlibdeps
# reads (DPKG_ADMINDIR) to find the packages a cross-built program needs.
# DIR is unpacked anew only when a package version or DIR's place changes, so
# an unchanged sysroot does not make the next build compile everything again.
set -euo pipefail
arch=${1:?usage: cross-sysroot.sh arm64|armhf DIR}
dir=$(realpath -m "${2:?usage: cross-sysroot.sh arm64|armhf DIR}")

packages=(
  libc6 libgcc-s1 libstdc++6
  libssl3 libssl-dev
  libtss2-dev libtss2-esys-3.0.2-0 libtss2-sys1 libtss2-mu0 libtss2-rc0 libtss2-tctildr0
  libtss2-tcti-swtpm0 libtss2-tcti-pcap0
  libgtest-dev
)

# shellcheck source=scripts/target-apt.sh
. "$(dirname "$0")/target-apt.sh"
apt_dir=$(mktemp -d)
trap 'rm -rf "$apt_dir"' EXIT
target_apt "$arch" "$apt_dir"

# The database names files by where they lie (see record_package): the
# stamp holds DIR's place with the package files.
wanted=$(echo "$dir" && apt-get download --print-uris "${packages[@]}" | cut -d" " -f2 | sort)
if [ "$(cat "$dir"/.packages 2>/dev/null)" = "$wanted" ]; then
  echo "$arch sysroot $dir is up to date"
  exit 0
fi
echo "Unpacking ${#packages[@]} $arch packages into $dir"
(cd "$apt_dir"/debs && apt-get download -q "${packages[@]}" >/dev/null)
rm -rf "$dir"
mkdir -p "$dir"

# record_package DEB enters an unpacked package in the sysroot's database as
# installed: its control fields, the shlibs and symbols files that say which
# package version a program linking its libraries depends on, and its file
# list. dpkg-shlibdeps asks dpkg-query which package holds a library by the
# path it found the library at, so the list names each file under DIR.
admin=$dir/var/lib/dpkg
record_package() {
  local deb=$1 control=$apt_dir/control name file
  rm -rf "$control"
  dpkg-deb -e "$deb" "$control"
  name=$(dpkg-deb -f "$deb" Package)
  # Info files of a Multi-Arch: same package carry its architecture.
  if [ "$(dpkg-deb -f "$deb" Multi-Arch)" = same ]; then
    name=$name:$arch
  fi
  { sed '/^Package:/a Status: install ok installed' "$control/control" && echo; } >>"$admin/status"
  for file in shlibs symbols; do
    [ ! -e "$control/$file" ] || cp "$control/$file" "$admin/info/$name.$file"
  done
  dpkg-deb --fsys-tarfile "$deb" | tar -t |
    awk -v root="$dir" '{ sub(/^\./, ""); sub(/\/$/, ""); if ($0 == "") $0 = "/."; print root $0 }' \
      >"$admin/info/$name.list"
}

mkdir -p "$admin/info" "$admin/updates"
echo 1 >"$admin/info/format"
: >"$admin/status"
for deb in "$apt_dir"/debs/*.deb; do
  dpkg-deb -x "$deb" "$dir"
  record_package "$deb"
done
echo "$wanted" >"$dir"/.packages
