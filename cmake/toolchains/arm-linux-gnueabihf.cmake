# 32-bit ARM Linux, hard float (Debian armhf), with Debian's
# g++-arm-linux-gnueabihf:
#   cmake -S . -B build-armhf --toolchain cmake/toolchains/arm-linux-gnueabihf.cmake \
#         -DKEYMGR_SYSROOT=SYSROOT
# scripts/test.sh --target armhf makes the sysroot and runs the tests under qemu.
# cmake/target_abi.cmake gives 32-bit targets a 64-bit off_t and time_t.
set(CMAKE_SYSTEM_PROCESSOR arm)
set(KEYMGR_CROSS_TRIPLET arm-linux-gnueabihf)
set(KEYMGR_CROSS_QEMU qemu-arm-static)
set(KEYMGR_DEB_ARCHITECTURE armhf)
# GCC notes where the passing of some types changed in GCC 7.1; every object
# here comes from one compiler.
set(CMAKE_CXX_FLAGS_INIT -Wno-psabi)
include(${CMAKE_CURRENT_LIST_DIR}/linux-gnu-cross.cmake)
