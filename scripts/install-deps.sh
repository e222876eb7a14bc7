#!/usr/bin/env bash
# Installs, on Debian 12, what one job of keymgr needs, only what is missing:
#   scripts/install-deps.sh JOB [PACKAGE...]
# JOB is one of
#   build    the compiler, CMake, Ninja, OpenSSL and tpm2-tss headers
#   demo     build, and a software TPM (swtpm) with tpm2-tools to start it
#   test     demo, and GoogleTest, the TPM tools the tests drive, strace, the
#            man page renderer, systemd-analyze, shellcheck and the Debian
#            packaging tools (hardening-check, from devscripts, is left out:
#            the suite skips that one test without it; add devscripts for it)
#   lint     build, clang-tidy, cppcheck, shellcheck and clang-format
#   fuzz     build, and clang with libFuzzer
#   package  build, and the Debian packaging tools
#   bench    test's TPM tools and GoogleTest, and GNU time
#   vm       package, swtpm, QEMU for ARM, U-Boot for QEMU, and the tools
#            that make the VM test's images and disks (scripts/vm-test.sh)
#   all      every job's, and devscripts: what CI runs
# Further PACKAGEs (a cross compiler, say) are installed with them. Without a
# JOB (the first word not a job's name) it installs what all does.
set -euo pipefail

build=(g++ cmake ninja-build pkg-config libssl-dev libtss2-dev)
tpm=(swtpm tpm2-tools libtss2-tcti-swtpm0)
packaging=(dpkg-dev file binutils)
declare -A jobs=(
  [build]="${build[*]}"
  [demo]="${build[*]} ${tpm[*]}"
  [test]="${build[*]} ${tpm[*]} swtpm-tools openssl libgtest-dev strace groff-base systemd
          shellcheck fakeroot ${packaging[*]}"
  [lint]="${build[*]} openssl clang-tidy cppcheck shellcheck clang-format"
  [fuzz]="${build[*]} clang libclang-rt-14-dev"
  [package]="${build[*]} ${packaging[*]}"
  [bench]="${build[*]} ${tpm[*]} swtpm-tools openssl libgtest-dev time"
  [vm]="${build[*]} ${tpm[*]} swtpm-tools ${packaging[*]} qemu-system-arm cpio e2fsprogs
        u-boot-qemu u-boot-tools mtools dosfstools fdisk"
)
jobs[all]="${jobs[*]} devscripts"

job=all
if [ -n "${1:-}" ] && [ -n "${jobs[$1]+set}" ]; then
  job=$1
  shift
fi
read -ra packages <<<"$(tr -s ' \n' '\n' <<<"${jobs[$job]}" | sort -u | tr '\n' ' ')"
packages+=("$@")

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed"; then
    missing+=("$p")
  fi
done
if [ ${#missing[@]} -eq 0 ]; then
  echo "everything the $job job needs is installed"
  exit 0
fi

echo "installing for the $job job: ${missing[*]}"
sudo=""
if [ "$(id -u)" -ne 0 ]; then
  command -v sudo >/dev/null || { echo "need root (or sudo) to install: ${missing[*]}" >&2; exit 1; }
  sudo="sudo"
fi
export DEBIAN_FRONTEND=noninteractive
$sudo apt-get update -q
$sudo apt-get install -y -q --no-install-recommends "${missing[@]}"
