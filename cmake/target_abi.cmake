# 32-bit targets build with a 64-bit off_t and time_t. With 32-bit ones, stat
# fails with EOVERFLOW on a listed file of 2 GiB or more, so the check reports
# "status error" where a device with a 64-bit C library reports "open error",
# and from 2038 on time() fails and the boot banner shows 1969.
if(CMAKE_SIZEOF_VOID_P EQUAL 4)
  set(KEYMGR_WIDE_TYPES _FILE_OFFSET_BITS=64 _TIME_BITS=64)
  add_compile_definitions(${KEYMGR_WIDE_TYPES})
  # _TIME_BITS needs glibc 2.34; an older C library ignores it.
  include(CheckTypeSize)
  list(TRANSFORM KEYMGR_WIDE_TYPES PREPEND -D OUTPUT_VARIABLE CMAKE_REQUIRED_DEFINITIONS)
  set(CMAKE_EXTRA_INCLUDE_FILES time.h)
  check_type_size(off_t KEYMGR_OFF_T_SIZE)
  check_type_size(time_t KEYMGR_TIME_T_SIZE)
  unset(CMAKE_EXTRA_INCLUDE_FILES)
  unset(CMAKE_REQUIRED_DEFINITIONS)
  if(NOT KEYMGR_OFF_T_SIZE EQUAL 8 OR NOT KEYMGR_TIME_T_SIZE EQUAL 8)
    message(FATAL_ERROR "off_t (${KEYMGR_OFF_T_SIZE} bytes) and time_t (${KEYMGR_TIME_T_SIZE} "
                        "bytes) must be 64 bits wide on this 32-bit target")
  endif()
endif()
