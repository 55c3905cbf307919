# Authenticode signing of the binaries we build.
#
# A serving process whose own image is unsigned refuses every peer, and peers
# are admitted by comparing their signer with ours, so every program and DLL
# of the build is signed after it links. By default the signer is "A", a
# throwaway code-signing certificate that openssl makes once per build tree
# (at configure time, under <build>/signing, never committed). Real
# credentials replace signer A through the cache variables
# VORBEL_SIGNING_CERT (PEM certificate chain, signer first) and
# VORBEL_SIGNING_KEY (PEM private key, unencrypted).
#
# The other throwaway signers exist for the tests:
#   B      another subject, same root
#   CASE   a subject that differs from A's only in letter case
#   SERIAL a fixed, deliberately awkward serial number (see below)
#   NONAME an empty subject (no simple display name)
#
# Functions:
#   vorbel_sign(<target> [SIGNER A|B|CASE|SERIAL|NONAME|NONE])
#       sign <target> after every link (NONE keeps it unsigned). Targets
#       that never call it are signed with A when the top-level directory
#       has been processed.
#   vorbel_tampered_copy(<new target> <signed target> OUTPUT <file> MARKER <text>)
#       copies the signed image of <signed target> to <file> and changes one
#       byte inside <text>, a string compiled into the program: the copy still
#       runs, but its digest no longer matches its signature.
#
# This file is also the script the build runs (cmake -P) for those two steps:
# as the link launcher of a signed target, and to make a tampered copy.

# ---------------------------------------------------------------------------
# Script mode
# ---------------------------------------------------------------------------
if(CMAKE_SCRIPT_MODE_FILE)
  # Arguments after "--" are the link command (launcher mode); the "--"
  # keeps cmake from reading the compiler's -D and -O flags as its own.
  set(_cmd)
  set(_after_separator FALSE)
  math(EXPR _last "${CMAKE_ARGC} - 1")
  foreach(_i RANGE ${_last})
    if(_after_separator)
      list(APPEND _cmd "${CMAKE_ARGV${_i}}")
    elseif(CMAKE_ARGV${_i} STREQUAL "--")
      set(_after_separator TRUE)
    endif()
  endforeach()

  function(_vorbel_run)
    execute_process(COMMAND ${ARGN} RESULT_VARIABLE _rc)
    if(NOT _rc EQUAL 0)
      list(GET ARGN 0 _tool)
      message(FATAL_ERROR "${_tool} failed (${_rc})")
    endif()
  endfunction()

  # Signs the freshly linked `file` in place.
  function(_vorbel_sign_file file)
    set(_tmp "${file}.signing")
    file(REMOVE "${_tmp}")
    execute_process(COMMAND "${VORBEL_OSSLSIGNCODE}" sign
        -certs "${VORBEL_SIGN_CERTS}" -key "${VORBEL_SIGN_KEY}" -h sha256
        -in "${file}" -out "${_tmp}"
      RESULT_VARIABLE _rc OUTPUT_VARIABLE _out ERROR_VARIABLE _out)
    if(NOT _rc EQUAL 0)
      file(REMOVE "${_tmp}")
      message(FATAL_ERROR "osslsigncode could not sign ${file}:\n${_out}")
    endif()
    file(RENAME "${_tmp}" "${file}")
    # The signed copy is a new file: give it the linker's permissions back.
    file(CHMOD "${file}" FILE_PERMISSIONS OWNER_READ OWNER_WRITE OWNER_EXECUTE
      GROUP_READ GROUP_EXECUTE WORLD_READ WORLD_EXECUTE)
  endfunction()

  if(VORBEL_SIGNING_ACTION STREQUAL "link")
    _vorbel_run(${_cmd})
    # The linked file: "-o <file>" (gcc, clang) or "/out:<file>" (link.exe).
    set(_output "")
    set(_take_next FALSE)
    foreach(_arg IN LISTS _cmd)
      if(_take_next)
        set(_output "${_arg}")
        set(_take_next FALSE)
      elseif(_arg STREQUAL "-o")
        set(_take_next TRUE)
      elseif(_arg MATCHES "^[/-][oO][uU][tT]:(.+)$")
        set(_output "${CMAKE_MATCH_1}")
      endif()
    endforeach()
    if(_output STREQUAL "")
      message(FATAL_ERROR "signing: no output file in the link command: ${_cmd}")
    endif()
    _vorbel_sign_file("${_output}")
  elseif(VORBEL_SIGNING_ACTION STREQUAL "tamper")
    # Copy, then change one letter of the marker: code and structure stay
    # intact, only the signed digest stops matching.
    file(READ "${VORBEL_TAMPER_INPUT}" _hex HEX)
    string(HEX "${VORBEL_TAMPER_MARKER}" _marker_hex)
    string(FIND "${_hex}" "${_marker_hex}" _at)
    # Hex positions must fall on a byte boundary; a hit on an odd position is
    # a coincidence of nibbles, so look for the next one.
    while(_at GREATER_EQUAL 0)
      math(EXPR _odd "${_at} % 2")
      if(_odd EQUAL 0)
        break()
      endif()
      math(EXPR _from "${_at} + 1")
      string(SUBSTRING "${_hex}" ${_from} -1 _rest)
      string(FIND "${_rest}" "${_marker_hex}" _next)
      if(_next LESS 0)
        set(_at -1)
      else()
        math(EXPR _at "${_from} + ${_next}")
      endif()
    endwhile()
    if(_at LESS 0)
      message(FATAL_ERROR "tamper: marker \"${VORBEL_TAMPER_MARKER}\" not found in ${VORBEL_TAMPER_INPUT}")
    endif()
    # The marker's first byte becomes '#', which no marker starts with.
    math(EXPR _offset "${_at} / 2")
    get_filename_component(_out_dir "${VORBEL_TAMPER_OUTPUT}" DIRECTORY)
    file(MAKE_DIRECTORY "${_out_dir}")
    file(COPY_FILE "${VORBEL_TAMPER_INPUT}" "${VORBEL_TAMPER_OUTPUT}")
    file(WRITE "${VORBEL_TAMPER_OUTPUT}.byte" "#")
    execute_process(COMMAND dd "of=${VORBEL_TAMPER_OUTPUT}" bs=1 "seek=${_offset}" count=1 conv=notrunc status=none
      INPUT_FILE "${VORBEL_TAMPER_OUTPUT}.byte" RESULT_VARIABLE _rc)
    file(REMOVE "${VORBEL_TAMPER_OUTPUT}.byte")
    if(NOT _rc EQUAL 0)
      file(REMOVE "${VORBEL_TAMPER_OUTPUT}")
      message(FATAL_ERROR "tamper: could not change ${VORBEL_TAMPER_OUTPUT}")
    endif()
  else()
    message(FATAL_ERROR "signing: unknown action \"${VORBEL_SIGNING_ACTION}\"")
  endif()
  return()
endif()

# ---------------------------------------------------------------------------
# Configure time: tools and throwaway certificates
# ---------------------------------------------------------------------------
set(VORBEL_SIGNING_CERT "" CACHE FILEPATH "PEM certificate chain to sign with instead of the throwaway signer A")
set(VORBEL_SIGNING_KEY "" CACHE FILEPATH "PEM private key of VORBEL_SIGNING_CERT")

find_program(VORBEL_OSSLSIGNCODE osslsigncode)
find_program(VORBEL_OPENSSL openssl)
set(VORBEL_SIGNING_DIR ${CMAKE_BINARY_DIR}/signing)
set(VORBEL_SIGNING_SCRIPT ${CMAKE_CURRENT_LIST_FILE})

if(NOT VORBEL_OSSLSIGNCODE OR NOT VORBEL_OPENSSL)
  message(WARNING "osslsigncode or openssl not found: binaries stay unsigned and signature tests fail")
  set(VORBEL_SIGNING_ENABLED FALSE)
else()
  set(VORBEL_SIGNING_ENABLED TRUE)
endif()

# Subjects and serial numbers of the throwaway signers. Serials are given
# explicitly with the top bit clear, so that their DER bytes are exactly the
# digits written here. SERIAL's number has a zero byte inside, bytes below
# 0x10 (zero-fill) and letters (lower-case hex), and is asymmetric, so any
# byte-order slip shows.
set(VORBEL_SIGNING_ROOT_SUBJECT "Vorbel Test Root")
set(VORBEL_SIGNER_A_SUBJECT "Vorbel Test Signer")
set(VORBEL_SIGNER_B_SUBJECT "Vorbel Other Signer")
set(VORBEL_SIGNER_CASE_SUBJECT "vORBEL tEST sIGNER")
set(VORBEL_SIGNER_SERIAL_SUBJECT "Vorbel Serial Signer")
set(VORBEL_SIGNER_SERIAL_NUMBER "01ab00c0ffee0a")
set(_vorbel_serials_root 7f0001)
set(_vorbel_serials_A 4a5b01)
set(_vorbel_serials_B 4a5b02)
set(_vorbel_serials_CASE 4a5b03)
set(_vorbel_serials_SERIAL ${VORBEL_SIGNER_SERIAL_NUMBER})
set(_vorbel_serials_NONAME 4a5b05)

function(_vorbel_openssl)
  execute_process(COMMAND "${VORBEL_OPENSSL}" ${ARGN}
    WORKING_DIRECTORY ${VORBEL_SIGNING_DIR}
    RESULT_VARIABLE _rc OUTPUT_VARIABLE _out ERROR_VARIABLE _out)
  if(NOT _rc EQUAL 0)
    message(FATAL_ERROR "openssl ${ARGN} failed:\n${_out}")
  endif()
endfunction()

# Leaf certificate `name`.pem with key `name`.key, issued by the root;
# `name`-chain.pem is what gets embedded: the leaf, then the root.
function(_vorbel_make_signer name subject serial)
  if(EXISTS ${VORBEL_SIGNING_DIR}/${name}-chain.pem)
    return()
  endif()
  if(subject STREQUAL "")
    set(_subj "/")
  else()
    set(_subj "/CN=${subject}")
  endif()
  _vorbel_openssl(req -new -newkey rsa:2048 -nodes -keyout ${name}.key -out ${name}.csr -subj "${_subj}")
  _vorbel_openssl(x509 -req -in ${name}.csr -CA root.pem -CAkey root.key
    -set_serial 0x${serial} -days 3650 -sha256 -extfile leaf.ext -out ${name}.pem)
  file(READ ${VORBEL_SIGNING_DIR}/${name}.pem _leaf)
  file(READ ${VORBEL_SIGNING_DIR}/root.pem _root)
  file(WRITE ${VORBEL_SIGNING_DIR}/${name}-chain.pem "${_leaf}${_root}")
  file(REMOVE ${VORBEL_SIGNING_DIR}/${name}.csr)
endfunction()

if(VORBEL_SIGNING_ENABLED)
  file(MAKE_DIRECTORY ${VORBEL_SIGNING_DIR})
  if(NOT EXISTS ${VORBEL_SIGNING_DIR}/root.pem)
    _vorbel_openssl(req -x509 -newkey rsa:2048 -nodes -keyout root.key -out root.pem
      -days 3650 -sha256 -subj "/CN=${VORBEL_SIGNING_ROOT_SUBJECT}" -set_serial 0x${_vorbel_serials_root}
      -addext "basicConstraints=critical,CA:TRUE"
      -addext "keyUsage=critical,keyCertSign,cRLSign")
  endif()
  file(WRITE ${VORBEL_SIGNING_DIR}/leaf.ext
    "basicConstraints=CA:FALSE\nkeyUsage=critical,digitalSignature\nextendedKeyUsage=codeSigning\n")
  _vorbel_make_signer(A "${VORBEL_SIGNER_A_SUBJECT}" ${_vorbel_serials_A})
  _vorbel_make_signer(B "${VORBEL_SIGNER_B_SUBJECT}" ${_vorbel_serials_B})
  _vorbel_make_signer(CASE "${VORBEL_SIGNER_CASE_SUBJECT}" ${_vorbel_serials_CASE})
  _vorbel_make_signer(SERIAL "${VORBEL_SIGNER_SERIAL_SUBJECT}" ${_vorbel_serials_SERIAL})
  _vorbel_make_signer(NONAME "" ${_vorbel_serials_NONAME})

  # Signer A: the given credentials, or the throwaway one.
  if(VORBEL_SIGNING_CERT OR VORBEL_SIGNING_KEY)
    if(NOT EXISTS "${VORBEL_SIGNING_CERT}" OR NOT EXISTS "${VORBEL_SIGNING_KEY}")
      message(FATAL_ERROR "VORBEL_SIGNING_CERT and VORBEL_SIGNING_KEY must both name existing files")
    endif()
    set(VORBEL_SIGNER_A_CERTS "${VORBEL_SIGNING_CERT}")
    set(VORBEL_SIGNER_A_KEY "${VORBEL_SIGNING_KEY}")
  else()
    set(VORBEL_SIGNER_A_CERTS ${VORBEL_SIGNING_DIR}/A-chain.pem)
    set(VORBEL_SIGNER_A_KEY ${VORBEL_SIGNING_DIR}/A.key)
  endif()

  # Signer A's serial as the signature reader writes it: the DER content
  # bytes, most significant first, lower case (a leading zero byte when the
  # top bit is set keeps the number positive).
  execute_process(COMMAND "${VORBEL_OPENSSL}" x509 -noout -serial -in "${VORBEL_SIGNER_A_CERTS}"
    OUTPUT_VARIABLE _serial RESULT_VARIABLE _rc OUTPUT_STRIP_TRAILING_WHITESPACE)
  if(NOT _rc EQUAL 0)
    message(FATAL_ERROR "cannot read the serial number of ${VORBEL_SIGNER_A_CERTS}")
  endif()
  string(REGEX REPLACE "^serial=" "" _serial "${_serial}")
  string(TOLOWER "${_serial}" _serial)
  string(LENGTH "${_serial}" _len)
  math(EXPR _odd "${_len} % 2")
  if(_odd)
    set(_serial "0${_serial}")
  endif()
  if(_serial MATCHES "^[89a-f]")
    set(_serial "00${_serial}")
  endif()
  set(VORBEL_SIGNER_A_SERIAL_NUMBER "${_serial}")
endif()

# ---------------------------------------------------------------------------
# Functions
# ---------------------------------------------------------------------------
function(vorbel_sign target)
  cmake_parse_arguments(S "" "SIGNER" "" ${ARGN})
  if(NOT S_SIGNER)
    set(S_SIGNER A)
  endif()
  if(NOT S_SIGNER MATCHES "^(A|B|CASE|SERIAL|NONAME|NONE)$")
    message(FATAL_ERROR "vorbel_sign(${target}): unknown signer ${S_SIGNER}")
  endif()
  set_property(TARGET ${target} PROPERTY VORBEL_SIGNER ${S_SIGNER})
  if(NOT VORBEL_SIGNING_ENABLED OR S_SIGNER STREQUAL "NONE")
    set_property(TARGET ${target} PROPERTY C_LINKER_LAUNCHER "")
    set_property(TARGET ${target} PROPERTY CXX_LINKER_LAUNCHER "")
    return()
  endif()
  if(S_SIGNER STREQUAL "A")
    set(_certs "${VORBEL_SIGNER_A_CERTS}")
    set(_key "${VORBEL_SIGNER_A_KEY}")
  else()
    set(_certs ${VORBEL_SIGNING_DIR}/${S_SIGNER}-chain.pem)
    set(_key ${VORBEL_SIGNING_DIR}/${S_SIGNER}.key)
  endif()
  # Signing rides on the link step itself (a launcher), so it works for
  # targets of any directory and the file is never seen unsigned by the
  # steps that copy it.
  set(_launcher ${CMAKE_COMMAND}
    -DVORBEL_SIGNING_ACTION=link
    -DVORBEL_OSSLSIGNCODE=${VORBEL_OSSLSIGNCODE}
    -DVORBEL_SIGN_CERTS=${_certs}
    -DVORBEL_SIGN_KEY=${_key}
    -P ${VORBEL_SIGNING_SCRIPT} --)
  set_property(TARGET ${target} PROPERTY C_LINKER_LAUNCHER "${_launcher}")
  set_property(TARGET ${target} PROPERTY CXX_LINKER_LAUNCHER "${_launcher}")
endfunction()

function(vorbel_tampered_copy name signed_target)
  cmake_parse_arguments(T "" "OUTPUT;MARKER" "" ${ARGN})
  if(NOT T_OUTPUT OR NOT T_MARKER)
    message(FATAL_ERROR "vorbel_tampered_copy(${name}): OUTPUT and MARKER are required")
  endif()
  add_custom_command(OUTPUT ${T_OUTPUT}
    COMMAND ${CMAKE_COMMAND}
      -DVORBEL_SIGNING_ACTION=tamper
      -DVORBEL_TAMPER_INPUT=$<TARGET_FILE:${signed_target}>
      -DVORBEL_TAMPER_OUTPUT=${T_OUTPUT}
      -DVORBEL_TAMPER_MARKER=${T_MARKER}
      -P ${VORBEL_SIGNING_SCRIPT}
    DEPENDS ${signed_target} ${VORBEL_SIGNING_SCRIPT}
    COMMENT "Tampering with a signed copy of ${signed_target}"
    VERBATIM)
  add_custom_target(${name} ALL DEPENDS ${T_OUTPUT})
endfunction()

# Every program and DLL that chose no signer is signed with A: the walk runs
# once the whole tree has been read, so it sees the targets of every folder.
function(_vorbel_sign_by_default dir)
  get_property(_targets DIRECTORY ${dir} PROPERTY BUILDSYSTEM_TARGETS)
  foreach(_t IN LISTS _targets)
    get_target_property(_type ${_t} TYPE)
    get_target_property(_signer ${_t} VORBEL_SIGNER)
    if(_type MATCHES "^(EXECUTABLE|SHARED_LIBRARY|MODULE_LIBRARY)$" AND NOT _signer)
      vorbel_sign(${_t})
    endif()
  endforeach()
  get_property(_subdirs DIRECTORY ${dir} PROPERTY SUBDIRECTORIES)
  foreach(_d IN LISTS _subdirs)
    _vorbel_sign_by_default(${_d})
  endforeach()
endfunction()

function(_vorbel_sign_all_by_default)
  _vorbel_sign_by_default(${PROJECT_SOURCE_DIR})
endfunction()

cmake_language(DEFER DIRECTORY ${CMAKE_SOURCE_DIR} CALL _vorbel_sign_all_by_default)
