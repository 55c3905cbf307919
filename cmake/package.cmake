# The install tree and the CMake package hosts build against.
#
#   <prefix>/bin/                 vorbel.dll, its sibling libraries, vorbel_host.exe
#   <prefix>/include/vorbel/      the public headers and host.h
#   <prefix>/lib/cmake/vorbel/    vorbelConfig.cmake and friends
#
# A host project:
#
#   find_package(vorbel 1.0 CONFIG REQUIRED)
#   target_link_libraries(my_host PRIVATE vorbel::headers)
#   vorbel_copy_runtime(my_host)     # the DLLs beside my_host.exe
#
# The shipped binaries install themselves (install() next to each target);
# test programs and test doubles have no install rules.

include(CMakePackageConfigHelpers)

# The headers and the header-only loader: no library to link, the component
# is loaded at run time (host.h).
add_library(vorbel_headers INTERFACE)
target_include_directories(vorbel_headers INTERFACE
  $<BUILD_INTERFACE:${PROJECT_SOURCE_DIR}/include>
  $<INSTALL_INTERFACE:${CMAKE_INSTALL_INCLUDEDIR}>)
target_compile_features(vorbel_headers INTERFACE cxx_std_17)
set_target_properties(vorbel_headers PROPERTIES EXPORT_NAME headers)
add_library(vorbel::headers ALIAS vorbel_headers)

install(TARGETS vorbel_headers EXPORT vorbelTargets)
install(DIRECTORY ${PROJECT_SOURCE_DIR}/include/vorbel
  DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}
  FILES_MATCHING PATTERN "*.h")

set(VORBEL_PACKAGE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/vorbel)
# What a host needs beside its program: the component and the libraries it
# loads from its own folder.
set(VORBEL_RUNTIME_DLL_NAMES vorbel.dll scribo.dll parlo.dll parlo_ipc.dll)

install(EXPORT vorbelTargets NAMESPACE vorbel:: DESTINATION ${VORBEL_PACKAGE_DIR})
configure_package_config_file(${CMAKE_CURRENT_LIST_DIR}/vorbelConfig.cmake.in
  ${CMAKE_BINARY_DIR}/package/vorbelConfig.cmake
  INSTALL_DESTINATION ${VORBEL_PACKAGE_DIR}
  PATH_VARS CMAKE_INSTALL_BINDIR)
# Not architecture-independent on purpose: the DLLs are 64-bit, a 32-bit
# host must not find them.
write_basic_package_version_file(${CMAKE_BINARY_DIR}/package/vorbelConfigVersion.cmake
  VERSION ${PROJECT_VERSION}
  COMPATIBILITY SameMajorVersion)
install(FILES
    ${CMAKE_BINARY_DIR}/package/vorbelConfig.cmake
    ${CMAKE_BINARY_DIR}/package/vorbelConfigVersion.cmake
  DESTINATION ${VORBEL_PACKAGE_DIR})
