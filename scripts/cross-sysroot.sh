#!/usr/bin/env bash
# Unpacks the Debian 12 libraries that keymgr builds and runs against, for a
# target architecture, into a sysroot folder:
#   cross-sysroot.sh arm64|armhf DIR
# The packages come from the machine's own Debian sources, read through a
# private apt state, so the machine's package database is left alone (no
# dpkg --add-architecture). The sysroot holds the target's own loader and C
# library: the emulator takes DIR as its library prefix, and a program never
# runs on a mix of the cross compiler's C library and another version of it.
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

sudo=""
[ "$(id -u)" -eq 0 ] || sudo="sudo"

# debian_sources prints "deb URI SUITE main" for each Debian suite the
# machine's apt knows (only known once its indexes were fetched).
debian_sources() {
  # shellcheck disable=SC2016 # $(FIELD) is apt's own placeholder
  apt-get indextargets --format 'deb $(REPO_URI) $(RELEASE) main' \
    'Identifier: Packages' 'Origin: Debian' | sort -u
}

apt_dir=$(mktemp -d)
trap 'rm -rf "$apt_dir"' EXIT
mkdir -p "$apt_dir"/lists/partial "$apt_dir"/cache/archives/partial "$apt_dir"/parts "$apt_dir"/debs
: >"$apt_dir"/status
if [ -z "$(debian_sources)" ]; then
  $sudo apt-get update -q
fi
debian_sources >"$apt_dir"/sources.list
[ -s "$apt_dir"/sources.list ] || { echo "no Debian package source is configured for apt" >&2; exit 1; }
cat >"$apt_dir"/apt.conf <<EOF
Dir::State "$apt_dir";
Dir::State::Lists "$apt_dir/lists";
Dir::State::status "$apt_dir/status";
Dir::Cache "$apt_dir/cache";
Dir::Etc::SourceList "$apt_dir/sources.list";
Dir::Etc::SourceParts "$apt_dir/parts";
APT::Architecture "$arch";
APT::Architectures { "$arch"; };
APT::Sandbox::User "root";
EOF
export APT_CONFIG=$apt_dir/apt.conf

# An index that does not come (the security suite's for armhf, at times)
# leaves the packages of the other suites, which make a sysroot that works
# as well: nothing in it has to match the machine's own versions.
if ! apt-get update -q >"$apt_dir"/update.log 2>&1; then
  grep -E '^(E|W):' "$apt_dir"/update.log >&2 || true
  echo "warning: some $arch package indexes did not come; using those that did" >&2
fi

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
