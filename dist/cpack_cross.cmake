# Read by cpack in a cross build. The dpkg-shlibdeps that makes the package's
# Depends reads the target's packages from the sysroot's dpkg database (as
# scripts/cross-sysroot.sh lays it out) and their symbols files for the
# target's architecture.
set(ENV{DPKG_ADMINDIR} "${CPACK_KEYMGR_DPKG_ADMINDIR}")
set(ENV{DEB_HOST_ARCH} "${CPACK_DEBIAN_PACKAGE_ARCHITECTURE}")
