# shellcheck shell=bash
# Sourced by the scripts that fetch Debian packages of the device's
# architecture, from the top of the tree:
#   . scripts/target-apt.sh
#   target_apt ARCH DIR
# target_apt reads the machine's own Debian sources through a private apt
# state in the folder DIR for the architecture ARCH (arm64, armhf), so that
# the machine's package database is left alone (no dpkg --add-architecture),
# and exports APT_CONFIG for it: apt-get download and apt-cache then answer
# for ARCH. DIR/debs is an empty folder to download into. The caller removes
# DIR when done.

# debian_sources prints "deb URI SUITE main" for each Debian suite the
# machine's apt knows (only known once its indexes were fetched).
debian_sources() {
  # shellcheck disable=SC2016 # $(FIELD) is apt's own placeholder
  apt-get indextargets --format 'deb $(REPO_URI) $(RELEASE) main' \
    'Identifier: Packages' 'Origin: Debian' | sort -u
}

target_apt() {
  local arch=$1 apt_dir=$2 sudo=""
  [ "$(id -u)" -eq 0 ] || sudo="sudo"
  mkdir -p "$apt_dir"/lists/partial "$apt_dir"/cache/archives/partial "$apt_dir"/parts "$apt_dir"/debs
  : >"$apt_dir"/status
  if [ -z "$(debian_sources)" ]; then
    $sudo apt-get update -q
  fi
  debian_sources >"$apt_dir"/sources.list
  [ -s "$apt_dir"/sources.list ] || { echo "no Debian package source is configured for apt" >&2; return 1; }
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
  # leaves the packages of the other suites, which serve as well: nothing
  # fetched here has to match the machine's own versions.
  if ! apt-get update -q >"$apt_dir"/update.log 2>&1; then
    grep -E '^(E|W):' "$apt_dir"/update.log >&2 || true
    echo "warning: some $arch package indexes did not come; using those that did" >&2
  fi
}
