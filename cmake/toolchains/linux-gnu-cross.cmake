# The part the ARM toolchain files share: Debian's cross compilers for
# KEYMGR_CROSS_TRIPLET, and qemu-user (KEYMGR_CROSS_QEMU) to run what they build.
# KEYMGR_DEB_ARCHITECTURE is the Debian architecture of the package they make.
#
# The target's libraries (OpenSSL, tpm2-tss, GoogleTest) come from
# KEYMGR_SYSROOT, a folder of the target's Debian packages such as
# scripts/cross-sysroot.sh unpacks (or a device SDK's sysroot). The emulator
# takes it as its library prefix, so the programs run on the sysroot's own
# loader and C library, never on a mix of it with the cross compiler's.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_C_COMPILER ${KEYMGR_CROSS_TRIPLET}-gcc)
set(CMAKE_CXX_COMPILER ${KEYMGR_CROSS_TRIPLET}-g++)

set(KEYMGR_SYSROOT "$ENV{KEYMGR_SYSROOT}" CACHE PATH
    "The target's libraries: unpacked packages (scripts/cross-sysroot.sh) or an SDK sysroot")
list(APPEND CMAKE_TRY_COMPILE_PLATFORM_VARIABLES KEYMGR_SYSROOT)

# Host programs (pkg-config, the tpm2 tools the tests use) from the machine;
# libraries, headers and packages only from the target's folders.
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)

if(NOT KEYMGR_SYSROOT)
  message(FATAL_ERROR "Set KEYMGR_SYSROOT to the target's libraries, for example a folder made by "
                      "scripts/cross-sysroot.sh")
endif()
# The compiler keeps its own C and C++ libraries to link against; the sysroot
# adds the others, and at run time supplies all of them.
set(CMAKE_SYSROOT "${KEYMGR_SYSROOT}")
set(CMAKE_CROSSCOMPILING_EMULATOR ${KEYMGR_CROSS_QEMU} -L "${KEYMGR_SYSROOT}")
set(ENV{PKG_CONFIG_SYSROOT_DIR} "${KEYMGR_SYSROOT}")
set(ENV{PKG_CONFIG_PATH} "")
set(ENV{PKG_CONFIG_LIBDIR}
    "${KEYMGR_SYSROOT}/usr/lib/${KEYMGR_CROSS_TRIPLET}/pkgconfig:${KEYMGR_SYSROOT}/usr/share/pkgconfig")
