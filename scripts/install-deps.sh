#!/usr/bin/env bash
# Installs what keymgr needs to build and test on Debian 12, only when some
# of it is missing. Further packages named as arguments (a cross compiler,
# say) are installed with them.
set -euo pipefail

packages=(
  g++ cmake ninja-build pkg-config
  libssl-dev openssl
  libgtest-dev
  libtss2-dev libtss2-tcti-swtpm0 tpm2-tools swtpm swtpm-tools
  valgrind clang-format strace time
  groff-base shellcheck systemd dpkg-dev file binutils
  clang libclang-rt-14-dev clang-tidy cppcheck devscripts
  "$@"
)

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed"; then
    missing+=("$p")
  fi
done
[ ${#missing[@]} -eq 0 ] && exit 0

echo "Installing: ${missing[*]}"
sudo=""
if [ "$(id -u)" -ne 0 ]; then
  command -v sudo >/dev/null || { echo "need root (or sudo) to install: ${missing[*]}" >&2; exit 1; }
  sudo="sudo"
fi
export DEBIAN_FRONTEND=noninteractive
$sudo apt-get update -q
$sudo apt-get install -y -q --no-install-recommends "${missing[@]}"
