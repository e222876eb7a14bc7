# The install tree and the Debian package: the programs, libkmm with kmm.h,
# its pkg-config file and CMake package, the man pages, the boot unit and the
# init script.
include(GNUInstallDirs)
include(CMakePackageConfigHelpers)

install(TARGETS keymgr kmm-host keymgr-eeprom keymgr-mkdigest keymgr-eventlog keymgr-mkpolicy
        RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})
install(TARGETS kmm kmm_shared EXPORT kmmTargets
        ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR}
        LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR})
install(FILES ${PROJECT_BINARY_DIR}/include/kmm/kmm.h DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/kmm)

set(_kmm_cmakedir ${CMAKE_INSTALL_LIBDIR}/cmake/kmm)
install(EXPORT kmmTargets NAMESPACE kmm:: DESTINATION ${_kmm_cmakedir})
configure_package_config_file(dist/kmmConfig.cmake.in ${PROJECT_BINARY_DIR}/dist/kmmConfig.cmake
                              INSTALL_DESTINATION ${_kmm_cmakedir})
write_basic_package_version_file(${PROJECT_BINARY_DIR}/dist/kmmConfigVersion.cmake
                                 COMPATIBILITY SameMajorVersion)
install(FILES ${PROJECT_BINARY_DIR}/dist/kmmConfig.cmake
              ${PROJECT_BINARY_DIR}/dist/kmmConfigVersion.cmake
        DESTINATION ${_kmm_cmakedir})

# The .pc file finds its prefix from where it lies, so that the tree can be
# installed under any prefix.
file(RELATIVE_PATH KMM_PC_PREFIX ${CMAKE_INSTALL_FULL_LIBDIR}/pkgconfig ${CMAKE_INSTALL_PREFIX})
string(REGEX REPLACE "/$" "" KMM_PC_PREFIX "${KMM_PC_PREFIX}")
configure_file(dist/kmm.pc.in ${PROJECT_BINARY_DIR}/dist/kmm.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/dist/kmm.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

install(FILES dist/man/keymgr.8 dist/man/kmm-host.8 dist/man/keymgr-eeprom.8
        DESTINATION ${CMAKE_INSTALL_MANDIR}/man8)
install(FILES dist/man/libkmm.3 DESTINATION ${CMAKE_INSTALL_MANDIR}/man3)
install(FILES dist/man/keymgr-mkdigest.1 dist/man/keymgr-eventlog.1 dist/man/keymgr-mkpolicy.1
        DESTINATION ${CMAKE_INSTALL_MANDIR}/man1)

# Boot integration. The unit and the script name the programs where this
# build installs them. A package build points KEYMGR_INITDIR at /etc/init.d.
set(KEYMGR_UNITDIR "lib/systemd/system" CACHE STRING "Where the systemd unit is installed")
set(KEYMGR_INITDIR "etc/init.d" CACHE STRING "Where the init script is installed")
set(KEYMGR_BOOT_LOG "${KEYMGR_ROOT}/quorvan/spool/log/keymgr.log")
# A measured build removes the event log with the status log, and first waits
# a while for a TPM whose driver probes late: a run that cannot measure fails,
# and no proof runs after it. Other builds keep the lines as they were.
set(KEYMGR_BOOT_PREPARE "")
set(KEYMGR_BOOT_PREPARE_UNIT "")
if(NOT KEYMGR_MEASURE_PCR STREQUAL "")
  set(_events "${KEYMGR_ROOT}/quorvan/spool/log/keymgr.events")
  set(KEYMGR_BOOT_PREPARE "rm -f \"${_events}\"\n    ")
  set(KEYMGR_BOOT_PREPARE_UNIT "ExecStartPre=-/bin/rm -f ${_events}\n")
  if(KEYMGR_TCTI MATCHES "^device:(.+)$")
    set(_wait "for _ in $(seq 20); do [ -e ${CMAKE_MATCH_1} ] && break; sleep 0.5; done")
    set(KEYMGR_BOOT_PREPARE "${_wait}\n    ${KEYMGR_BOOT_PREPARE}")
    # systemd takes "$$" for a "$" of the shell's.
    string(REPLACE "$" "$$" _wait_unit "${_wait}")
    set(KEYMGR_BOOT_PREPARE_UNIT "ExecStartPre=-/bin/sh -c '${_wait_unit}'\n${KEYMGR_BOOT_PREPARE_UNIT}")
  endif()
endif()
# A measured build also ships the measured integration: the boot proof from
# an initramfs-tools initramfs, over the root before the system switches to
# it (docs/chain-of-trust.md).
if(NOT KEYMGR_MEASURE_PCR STREQUAL "")
  install(FILES dist/initramfs/keymgr-root.sh DESTINATION ${CMAKE_INSTALL_DATADIR}/keymgr)
  install(PROGRAMS dist/initramfs/hooks/keymgr
          DESTINATION ${CMAKE_INSTALL_DATADIR}/initramfs-tools/hooks)
  install(PROGRAMS dist/initramfs/scripts/local-bottom/keymgr
          DESTINATION ${CMAKE_INSTALL_DATADIR}/initramfs-tools/scripts/local-bottom)
endif()
configure_file(dist/keymgr-boot.service.in ${PROJECT_BINARY_DIR}/dist/keymgr-boot.service @ONLY)
configure_file(dist/keymgr-boot.init.in ${PROJECT_BINARY_DIR}/dist/keymgr-boot @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/dist/keymgr-boot.service DESTINATION ${KEYMGR_UNITDIR})
install(PROGRAMS ${PROJECT_BINARY_DIR}/dist/keymgr-boot DESTINATION ${KEYMGR_INITDIR})

# cpack -G DEB: one package, its Depends found by dpkg-shlibdeps.
set(CPACK_PACKAGE_NAME keymgr)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_CONTACT "keymgr developers <keymgr@localhost>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY
    "boot-time file integrity check and TPM-backed key management")
set(CPACK_DEBIAN_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_SET_DESTDIR ON)
set(CPACK_STRIP_FILES ON)
# A cross build's toolchain file names the target's Debian architecture.
if(KEYMGR_DEB_ARCHITECTURE)
  set(CPACK_DEBIAN_PACKAGE_ARCHITECTURE ${KEYMGR_DEB_ARCHITECTURE})
endif()
# A cross build's dpkg-shlibdeps finds the libraries the programs link in the
# sysroot, and the packages holding them in the sysroot's own dpkg database
# (dist/cpack_cross.cmake), never in the machine's.
if(CMAKE_CROSSCOMPILING AND CMAKE_SYSROOT)
  foreach(_dir lib usr/lib)
    list(APPEND CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS
         ${CMAKE_SYSROOT}/${_dir}/${CMAKE_LIBRARY_ARCHITECTURE})
  endforeach()
  set(CPACK_KEYMGR_DPKG_ADMINDIR ${CMAKE_SYSROOT}/var/lib/dpkg)
  set(CPACK_PROJECT_CONFIG_FILE ${PROJECT_SOURCE_DIR}/dist/cpack_cross.cmake)
endif()
include(CPack)
