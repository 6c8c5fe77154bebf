# Writes the systemd units from their templates. systemd expands no
# variables in ListenStream=, so the device root and the programs' directory
# are written in. Used at configure time (units in the build tree, for
# checking) and again at install time, when the prefix is final.
#
# In: TALLYRUN_UNIT_TEMPLATE_DIR, TALLYRUN_UNIT_OUTPUT_DIR,
#     TALLYRUN_DEVICE_ROOT, TALLYRUN_BIN_DIR.

set(TALLYRUN_UNITS tallyrun.service tallyrun.socket tallyrun-daily.service tallyrun-daily.timer)
set(TALLYRUN_SOCKET_NAME "com.velmora.tallybookd.tallyrun.sock")

# A unit file takes a path as it is: no quoting, and '%' starts a specifier.
function(tallyrun_check_unit_path what path)
  if(NOT path MATCHES "^/[A-Za-z0-9._+/-]*$")
    message(FATAL_ERROR "${what} must be an absolute path of letters, digits and ._+-/ for the systemd units: '${path}'")
  endif()
endfunction()

tallyrun_check_unit_path(TALLYRUN_DEVICE_ROOT "${TALLYRUN_DEVICE_ROOT}")
tallyrun_check_unit_path("The programs' directory" "${TALLYRUN_BIN_DIR}")
# Trailing slashes off, as the job takes the root; "/" stays itself.
string(REGEX REPLACE "(.)/+$" "\\1" TALLYRUN_DEVICE_ROOT "${TALLYRUN_DEVICE_ROOT}")
if(TALLYRUN_DEVICE_ROOT STREQUAL "/")
  set(TALLYRUN_SOCKET_PATH "/var/run/${TALLYRUN_SOCKET_NAME}")
else()
  set(TALLYRUN_SOCKET_PATH "${TALLYRUN_DEVICE_ROOT}/var/run/${TALLYRUN_SOCKET_NAME}")
endif()
# A Unix socket's path holds at most 107 bytes.
string(LENGTH "${TALLYRUN_SOCKET_PATH}" socket_path_length)
if(socket_path_length GREATER 107)
  message(FATAL_ERROR "TALLYRUN_DEVICE_ROOT is too long: the service socket's path under it would be "
                      "${socket_path_length} bytes, over the 107 a Unix socket takes")
endif()

foreach(unit IN LISTS TALLYRUN_UNITS)
  configure_file("${TALLYRUN_UNIT_TEMPLATE_DIR}/${unit}.in" "${TALLYRUN_UNIT_OUTPUT_DIR}/${unit}" @ONLY)
endforeach()
