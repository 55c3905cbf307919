# Windows version resources.
#
# Every program and DLL of the build carries a VERSIONINFO resource, so that
# Explorer, installers and support tools can tell which build a file comes
# from. The numbers come from one place, project(vorbel VERSION ...); the
# product name is "vorbel" for every file, the company is VORBEL_COMPANY_NAME,
# and each file has its own description.
#
#   vorbel_version_resource(<target> DESCRIPTION "<text>")
#       gives <target> its description. Targets that never call it get
#       "<target> (vorbel build)".
#
# The resources are generated once the whole tree has been read (like the
# default signing), because a file's name (PREFIX, OUTPUT_NAME, SUFFIX) may
# be set after the target is created.

enable_language(RC)

set(VORBEL_COMPANY_NAME "The vorbel developers" CACHE STRING
  "CompanyName of the version resource of every binary")
set(VORBEL_PRODUCT_NAME "vorbel")
set(VORBEL_VERSION_TEMPLATE ${CMAKE_CURRENT_LIST_DIR}/version.rc.in)

# A VERSIONINFO number has four 16-bit parts; a missing part is 0.
foreach(_part MAJOR MINOR PATCH TWEAK)
  set(_value "${PROJECT_VERSION_${_part}}")
  if(_value STREQUAL "")
    set(_value 0)
  endif()
  if(_value GREATER 65535)
    message(FATAL_ERROR "version part ${_part} (${_value}) does not fit a version resource (at most 65535)")
  endif()
  set(VORBEL_VERSION_${_part} ${_value})
endforeach()
set(VORBEL_VERSION_COMMAS
  "${VORBEL_VERSION_MAJOR},${VORBEL_VERSION_MINOR},${VORBEL_VERSION_PATCH},${VORBEL_VERSION_TWEAK}")

function(vorbel_version_resource target)
  cmake_parse_arguments(V "" "DESCRIPTION" "" ${ARGN})
  if(NOT TARGET ${target})
    message(FATAL_ERROR "vorbel_version_resource: no target ${target}")
  endif()
  if(V_UNPARSED_ARGUMENTS OR V_DESCRIPTION STREQUAL "")
    message(FATAL_ERROR "vorbel_version_resource(${target} DESCRIPTION \"...\"): a description is required")
  endif()
  set_property(TARGET ${target} PROPERTY VORBEL_VERSION_DESCRIPTION "${V_DESCRIPTION}")
endfunction()

# A string literal of a resource script: backslashes and double quotes are
# escaped, everything else is taken as UTF-8 (the template says so).
function(_vorbel_rc_string out text)
  string(REPLACE "\\" "\\\\" text "${text}")
  string(REPLACE "\"" "\"\"" text "${text}")
  set(${out} "${text}" PARENT_SCOPE)
endfunction()

# The name of the file `target` links to, as the linker writes it.
function(_vorbel_target_file_name target type out)
  get_target_property(_name ${target} OUTPUT_NAME)
  if(_name MATCHES "-NOTFOUND$")
    set(_name ${target})
  endif()
  get_target_property(_prefix ${target} PREFIX)
  get_target_property(_suffix ${target} SUFFIX)
  if(type STREQUAL "EXECUTABLE")
    set(_default_prefix "")
    set(_default_suffix "${CMAKE_EXECUTABLE_SUFFIX}")
  elseif(type STREQUAL "MODULE_LIBRARY")
    set(_default_prefix "${CMAKE_SHARED_MODULE_PREFIX}")
    set(_default_suffix "${CMAKE_SHARED_MODULE_SUFFIX}")
  else()
    set(_default_prefix "${CMAKE_SHARED_LIBRARY_PREFIX}")
    set(_default_suffix "${CMAKE_SHARED_LIBRARY_SUFFIX}")
  endif()
  # An unset property reads as <VAR>-NOTFOUND; an empty one is a choice.
  if(_prefix MATCHES "-NOTFOUND$")
    set(_prefix "${_default_prefix}")
  endif()
  if(_suffix MATCHES "-NOTFOUND$")
    set(_suffix "${_default_suffix}")
  endif()
  set(${out} "${_prefix}${_name}${_suffix}" PARENT_SCOPE)
endfunction()

function(_vorbel_add_version_resource target type)
  get_target_property(_description ${target} VORBEL_VERSION_DESCRIPTION)
  if(_description MATCHES "-NOTFOUND$")
    set(_description "${target} (vorbel build)")
  endif()
  _vorbel_target_file_name(${target} ${type} _file_name)
  if(type STREQUAL "EXECUTABLE")
    set(VORBEL_RC_FILE_TYPE VFT_APP)
  else()
    set(VORBEL_RC_FILE_TYPE VFT_DLL)
  endif()
  _vorbel_rc_string(VORBEL_RC_DESCRIPTION "${_description}")
  _vorbel_rc_string(VORBEL_RC_COMPANY "${VORBEL_COMPANY_NAME}")
  _vorbel_rc_string(VORBEL_RC_PRODUCT "${VORBEL_PRODUCT_NAME}")
  _vorbel_rc_string(VORBEL_RC_INTERNAL_NAME "${target}")
  _vorbel_rc_string(VORBEL_RC_ORIGINAL_FILENAME "${_file_name}")
  set(_rc ${CMAKE_BINARY_DIR}/version_resources/${target}.rc)
  configure_file(${VORBEL_VERSION_TEMPLATE} ${_rc} @ONLY)
  target_sources(${target} PRIVATE ${_rc})
endfunction()

function(_vorbel_version_resources_in dir)
  get_property(_targets DIRECTORY ${dir} PROPERTY BUILDSYSTEM_TARGETS)
  foreach(_t IN LISTS _targets)
    get_target_property(_type ${_t} TYPE)
    if(_type MATCHES "^(EXECUTABLE|SHARED_LIBRARY|MODULE_LIBRARY)$")
      _vorbel_add_version_resource(${_t} ${_type})
    endif()
  endforeach()
  get_property(_subdirs DIRECTORY ${dir} PROPERTY SUBDIRECTORIES)
  foreach(_d IN LISTS _subdirs)
    _vorbel_version_resources_in(${_d})
  endforeach()
endfunction()

function(_vorbel_version_resources_all)
  _vorbel_version_resources_in(${PROJECT_SOURCE_DIR})
endfunction()

cmake_language(DEFER DIRECTORY ${CMAKE_SOURCE_DIR} CALL _vorbel_version_resources_all)
