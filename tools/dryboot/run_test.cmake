# Runs dryboot on a fresh volume directory and judges its exit status and
# output. Called as
#   cmake -DVOLUME=<dir> [-DKERNEL=<file>] -DEXIT=<status> -DEXPECT=<regexes>
#         -P run_test.cmake -- <dryboot> [arguments...]
# The volume directory is made afresh with an extensions directory, the
# kernel (when given) is copied into it as nimb_kernel with one driver
# bundle beside it, and the directory is passed as dryboot's last argument.
# Every regex of the list EXPECT must match the output.
set(command)
set(collect OFF)
math(EXPR last "${CMAKE_ARGC} - 1")
foreach(i RANGE ${last})
  if(collect AND (command OR NOT CMAKE_ARGV${i} STREQUAL "--"))
    list(APPEND command "${CMAKE_ARGV${i}}")
  elseif(CMAKE_ARGV${i} MATCHES "run_test\\.cmake$")
    set(collect ON)
  endif()
endforeach()

if(DEFINED KERNEL AND NOT EXISTS "${KERNEL}")
  message("dryboot test skipped: no reference kernel at ${KERNEL}")
  return()
endif()
file(REMOVE_RECURSE "${VOLUME}")
# An empty extensions directory: a plain kernel's drivers are scanned there,
# and a volume without one cannot boot.
file(MAKE_DIRECTORY "${VOLUME}/System/Library/Extensions")
if(DEFINED KERNEL)
  file(COPY_FILE "${KERNEL}" "${VOLUME}/nimb_kernel")
  # One driver bundle without code, which the plain kernel gets staged.
  file(WRITE "${VOLUME}/System/Library/Extensions/A.drvb/Info.plist"
       "<plist version=\"1.0\"><dict><key>VzBundleRequired</key><string>Root</string></dict></plist>\n")
endif()

execute_process(COMMAND ${command} "${VOLUME}" RESULT_VARIABLE status OUTPUT_VARIABLE output ERROR_VARIABLE output)
message("${output}")
set(problems)
if(NOT status STREQUAL "${EXIT}")
  list(APPEND problems "exit status ${status}, wanted ${EXIT}")
endif()
foreach(pattern IN LISTS EXPECT)
  if(NOT output MATCHES "${pattern}")
    list(APPEND problems "no match for '${pattern}'")
  endif()
endforeach()
if(problems)
  list(JOIN problems "; " text)
  message(FATAL_ERROR "dryboot: ${text}")
endif()
