# flatbuffers comes from the build machine (Debian's flatbuffers-compiler and
# libflatbuffers-dev). Its headers are plain C++, but /usr/include must never
# reach the cross compiler, so the build tree gets a folder that holds only a
# link to them.
find_program(FLATC_EXECUTABLE flatc REQUIRED NO_CMAKE_FIND_ROOT_PATH)
find_path(FLATBUFFERS_HOST_INCLUDE flatbuffers/flatbuffers.h
  PATHS /usr/include /usr/local/include NO_DEFAULT_PATH NO_CMAKE_FIND_ROOT_PATH REQUIRED)

set(VORBEL_FB_INCLUDE ${CMAKE_BINARY_DIR}/third_party/include)
file(MAKE_DIRECTORY ${VORBEL_FB_INCLUDE})
if(NOT EXISTS ${VORBEL_FB_INCLUDE}/flatbuffers)
  file(CREATE_LINK ${FLATBUFFERS_HOST_INCLUDE}/flatbuffers ${VORBEL_FB_INCLUDE}/flatbuffers SYMBOLIC)
endif()
add_library(flatbuffers_headers INTERFACE)
target_include_directories(flatbuffers_headers SYSTEM INTERFACE ${VORBEL_FB_INCLUDE})

# vorbel_flatc(<target> <schema.fbs>): generates <name>_generated.h into the
# build tree and puts its folder on <target>'s include path.
function(vorbel_flatc target schema)
  get_filename_component(_abs ${schema} ABSOLUTE)
  get_filename_component(_name ${schema} NAME_WE)
  set(_out_dir ${CMAKE_CURRENT_BINARY_DIR}/generated)
  set(_out ${_out_dir}/${_name}_generated.h)
  add_custom_command(OUTPUT ${_out}
    COMMAND ${FLATC_EXECUTABLE} --cpp --scoped-enums -o ${_out_dir} ${_abs}
    DEPENDS ${_abs}
    COMMENT "flatc ${_name}.fbs")
  # The rule lives in this folder; a custom target carries it to `target`,
  # which may be defined in another folder.
  add_custom_target(${_name}_generated DEPENDS ${_out})
  add_dependencies(${target} ${_name}_generated)
  target_include_directories(${target} PUBLIC ${_out_dir})
  target_link_libraries(${target} PUBLIC flatbuffers_headers)
endfunction()
