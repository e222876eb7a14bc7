# shellcheck shell=bash disable=SC2034 # the variables are read by the sourcing script
# Sourced by the scripts that build for the device, from the top of the tree:
#   . scripts/cross-setup.sh aarch64|armhf BUILD_DIR
# Installs Debian's cross compiler for the target and qemu-user-static,
# unpacks the target's libraries into BUILD_DIR/sysroot and sets triplet,
# debian_arch, cpu (qemu's name for it) and cross_args, the CMake arguments
# of a build for it. The sourcing script defines usage.
case "$1" in
  aarch64) triplet=aarch64-linux-gnu debian_arch=arm64 cpu=aarch64 ;;
  armhf) triplet=arm-linux-gnueabihf debian_arch=armhf cpu=arm ;;
  *) usage ;;
esac
bash scripts/install-deps.sh "g++-$triplet" qemu-user-static
bash scripts/cross-sysroot.sh "$debian_arch" "$2/sysroot"
cross_args=(--toolchain "cmake/toolchains/$triplet.cmake" -DKEYMGR_SYSROOT="$PWD/$2/sysroot")
