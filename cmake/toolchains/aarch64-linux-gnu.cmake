# 64-bit ARM Linux (Debian arm64), with Debian's g++-aarch64-linux-gnu:
#   cmake -S . -B build-aarch64 --toolchain cmake/toolchains/aarch64-linux-gnu.cmake \
#         -DKEYMGR_SYSROOT=SYSROOT
# scripts/test.sh --target aarch64 makes the sysroot and runs the tests under qemu.
set(CMAKE_SYSTEM_PROCESSOR aarch64)
set(KEYMGR_CROSS_TRIPLET aarch64-linux-gnu)
set(KEYMGR_CROSS_QEMU qemu-aarch64-static)
set(KEYMGR_DEB_ARCHITECTURE arm64)
include(${CMAKE_CURRENT_LIST_DIR}/linux-gnu-cross.cmake)
