# The installed package as a host project uses it: install the build into a
# fresh prefix, configure examples/minimal_host with the same toolchain and
# CMAKE_PREFIX_PATH=<prefix>, build it (the package copies the runtime beside
# the program), run it under Wine and read what it printed and logged.
#
# Run with cmake -P and:
#   VORBEL_SOURCE_DIR, VORBEL_BUILD_DIR  the tree to install
#   WORK_DIR                             scratch folder, emptied first
#   CONFIG, GENERATOR, MAKE_PROGRAM, TOOLCHAIN
#   EMULATOR                             runs a Windows program (Wine)
cmake_minimum_required(VERSION 3.20)

foreach(_var VORBEL_SOURCE_DIR VORBEL_BUILD_DIR WORK_DIR GENERATOR TOOLCHAIN EMULATOR)
  if(NOT DEFINED ${_var} OR "${${_var}}" STREQUAL "")
    message(FATAL_ERROR "consumer_test: ${_var} is not set")
  endif()
endforeach()
if(NOT CONFIG)
  set(CONFIG RelWithDebInfo)
endif()

set(_prefix ${WORK_DIR}/prefix)
set(_host_build ${WORK_DIR}/minimal_host)
set(_timings "")

# _run(<label> <timeout seconds> <output var> <command>...): runs one step,
# fails the test with everything it printed unless it exits with 0.
function(_run label timeout out_var)
  string(TIMESTAMP _start "%s%f")
  execute_process(COMMAND ${ARGN}
    RESULT_VARIABLE _rc OUTPUT_VARIABLE _out ERROR_VARIABLE _err
    TIMEOUT ${timeout})
  string(TIMESTAMP _end "%s%f")
  math(EXPR _ms "(${_end} - ${_start}) / 1000")
  if(NOT _rc STREQUAL "0")
    message(FATAL_ERROR "${label} failed (${_rc}) after ${_ms} ms\n--- stdout:\n${_out}\n--- stderr:\n${_err}")
  endif()
  set(${out_var} "${_out}" PARENT_SCOPE)
  set(_timings "${_timings} ${label} ${_ms} ms," PARENT_SCOPE)
endfunction()

file(REMOVE_RECURSE ${WORK_DIR})
file(MAKE_DIRECTORY ${WORK_DIR})

# --- install -----------------------------------------------------------------
_run(install 60 _out
  ${CMAKE_COMMAND} --install ${VORBEL_BUILD_DIR} --prefix ${_prefix} --config ${CONFIG})

# Exactly the shipped files: the runtime, the public headers and the package;
# no test program, test double, import library or static library.
file(GLOB _headers RELATIVE ${VORBEL_SOURCE_DIR} ${VORBEL_SOURCE_DIR}/include/vorbel/*.h)
set(_expected
  bin/parlo.dll bin/parlo_ipc.dll bin/scribo.dll bin/vorbel.dll bin/vorbel_host.exe
  ${_headers}
  lib/cmake/vorbel/vorbelConfig.cmake
  lib/cmake/vorbel/vorbelConfigVersion.cmake
  lib/cmake/vorbel/vorbelTargets.cmake)
file(GLOB_RECURSE _installed RELATIVE ${_prefix} ${_prefix}/*)
list(SORT _expected)
list(SORT _installed)
if(NOT _installed STREQUAL _expected)
  set(_missing ${_expected})
  list(REMOVE_ITEM _missing ${_installed})
  set(_extra ${_installed})
  list(REMOVE_ITEM _extra ${_expected})
  message(FATAL_ERROR "install layout differs\n  missing: ${_missing}\n  unexpected: ${_extra}")
endif()
foreach(_header IN LISTS _headers)
  file(SHA256 ${VORBEL_SOURCE_DIR}/${_header} _source_hash)
  file(SHA256 ${_prefix}/${_header} _installed_hash)
  if(NOT _source_hash STREQUAL _installed_hash)
    message(FATAL_ERROR "installed ${_header} differs from the source")
  endif()
endforeach()

# --- configure and build the example as a host project ------------------------
set(_configure ${CMAKE_COMMAND} -S ${VORBEL_SOURCE_DIR}/examples/minimal_host -B ${_host_build}
  -G ${GENERATOR}
  -DCMAKE_TOOLCHAIN_FILE=${TOOLCHAIN}
  -DCMAKE_PREFIX_PATH=${_prefix}
  -DCMAKE_BUILD_TYPE=${CONFIG}
  # Only the prefix may provide the package, never a registry entry.
  -DCMAKE_FIND_USE_PACKAGE_REGISTRY=OFF)
if(MAKE_PROGRAM)
  list(APPEND _configure -DCMAKE_MAKE_PROGRAM=${MAKE_PROGRAM})
endif()
_run(configure 90 _out ${_configure})

file(STRINGS ${_host_build}/CMakeCache.txt _found REGEX "^vorbel_DIR:")
if(NOT _found STREQUAL "vorbel_DIR:PATH=${_prefix}/lib/cmake/vorbel")
  message(FATAL_ERROR "the example found the package elsewhere: ${_found}")
endif()

_run(build 90 _out ${CMAKE_COMMAND} --build ${_host_build} --config ${CONFIG})

set(_exe ${_host_build}/minimal_host.exe)
if(NOT EXISTS ${_exe})
  message(FATAL_ERROR "no ${_exe} after the build")
endif()
# The package's copy: the installed runtime, byte for byte, beside the program.
foreach(_dll vorbel.dll scribo.dll parlo.dll parlo_ipc.dll)
  if(NOT EXISTS ${_host_build}/${_dll})
    message(FATAL_ERROR "vorbel_copy_runtime left no ${_dll} beside the program")
  endif()
  file(SHA256 ${_prefix}/bin/${_dll} _installed_hash)
  file(SHA256 ${_host_build}/${_dll} _copied_hash)
  if(NOT _installed_hash STREQUAL _copied_hash)
    message(FATAL_ERROR "${_dll} beside the program is not the installed one")
  endif()
endforeach()

# --- run it under Wine --------------------------------------------------------
# The component's lines go to a file of ours (Wine maps / to drive Z:).
set(_log ${WORK_DIR}/minimal_host.log)
string(REPLACE "/" "\\" _log_windows "Z:${_log}")
set(ENV{SCRIBO_LOG_FILE} "${_log_windows}")
set(ENV{SCRIBO_LOG_LEVEL} "all")

string(TIMESTAMP _start "%s%f")
execute_process(COMMAND ${EMULATOR} ${_exe}
  WORKING_DIRECTORY ${_host_build}
  RESULT_VARIABLE _rc OUTPUT_VARIABLE _out ERROR_VARIABLE _err
  TIMEOUT 30)
string(TIMESTAMP _end "%s%f")
math(EXPR _ms "(${_end} - ${_start}) / 1000")
string(APPEND _timings " run ${_ms} ms")
string(REPLACE "\r\n" "\n" _out "${_out}")

set(_expected_output [[
loaded vorbel.dll and created the registry
created bus "minimal" with channel "alerts"
observer added
registered listener alerts/minimal-host-1
heard: new listener alerts/minimal-host-1 in this process
the bus knows the listener
unregistered listener alerts/minimal-host-1
heard: listener removed alerts/minimal-host-1 in this process
the bus no longer knows the listener
observer removed
bus destroyed
registry given back and vorbel.dll unloaded
done
]])
# Under Wine a crash may still end with 0, so the crash report counts too.
if(NOT _rc STREQUAL "0" OR NOT _out STREQUAL _expected_output
   OR _err MATCHES "Unhandled exception|Unhandled page fault")
  message(FATAL_ERROR "minimal_host exited with ${_rc}\n--- stdout:\n${_out}\n--- stderr:\n${_err}\n--- expected stdout:\n${_expected_output}")
endif()

# The component it loaded wrote through the logging library beside it.
if(NOT EXISTS ${_log})
  message(FATAL_ERROR "no log at ${_log}: scribo.dll beside the program was not used")
endif()
file(READ ${_log} _log_text)
foreach(_line
    "notify_new_listener pid=[0-9]+ channel=alerts id=minimal-host-1"
    "notify_listener_removed pid=[0-9]+ channel=alerts id=minimal-host-1")
  if(NOT _log_text MATCHES "${_line}")
    message(FATAL_ERROR "the log lacks \"${_line}\":\n${_log_text}")
  endif()
endforeach()

message(STATUS "package consumer test passed:${_timings}")
