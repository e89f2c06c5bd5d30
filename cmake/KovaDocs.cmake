# Build-time generator (cmake -P) for what is made from doc/error-codes.txt and the README.
#
#   -DMODE=header -DTABLE=<error-codes.txt> -DOUT=<header> -DINCLUDE_DIR=<include/kovacredential>
#       writes the C++ table kovacred names error codes with, after checking that the table
#       lists exactly the codes the public headers define (cred_request.h, kovaplatform.h).
#   -DMODE=man -DSOURCE=<page.scd> -DTABLE=<error-codes.txt> -DREADME=<README.md>
#       -DVERSION=<x.y.z> -DSCDOC=<scdoc> -DGZIP=<gzip> -DOUT=<page.N.gz>
#       fills the page's @ERROR_CODES@, @SAFETY_GUARANTEES@ and @VERSION@, turns it into roff
#       with scdoc and compresses it the way Debian ships manual pages (gzip -9n).
cmake_minimum_required(VERSION 3.18)

# Reads the table into the lists CODES, NAMES and MEANINGS (same order as the file).
function(kova_read_error_table path)
  file(STRINGS "${path}" lines ENCODING UTF-8)
  set(codes)
  set(names)
  set(meanings)
  foreach(line IN LISTS lines)
    if(line MATCHES "^#" OR line STREQUAL "")
      continue()
    endif()
    if(NOT line MATCHES "^([0-9]+) ([A-Z0-9_]+) (.+)$")
      message(FATAL_ERROR "${path}: malformed line: ${line}")
    endif()
    list(APPEND codes "${CMAKE_MATCH_1}")
    list(APPEND names "${CMAKE_MATCH_2}")
    list(APPEND meanings "${CMAKE_MATCH_3}")
  endforeach()
  set(CODES "${codes}" PARENT_SCOPE)
  set(NAMES "${names}" PARENT_SCOPE)
  set(MEANINGS "${meanings}" PARENT_SCOPE)
endfunction()

# Text that scdoc must print as it stands: its markup characters are escaped.
function(kova_scd_escape text out)
  string(REGEX REPLACE "([\\\\*_])" "\\\\\\1" text "${text}")
  set(${out} "${text}" PARENT_SCOPE)
endfunction()

# The README's "## Safety guarantees" section as scdoc: its paragraphs and its bullet list,
# with Markdown code spans shown in bold.
function(kova_safety_guarantees readme out)
  file(READ "${readme}" text)
  string(FIND "${text}" "\n## Safety guarantees\n" start)
  if(start EQUAL -1)
    message(FATAL_ERROR "${readme} has no \"## Safety guarantees\" section")
  endif()
  math(EXPR start "${start} + 22")
  string(SUBSTRING "${text}" ${start} -1 text)
  string(FIND "${text}" "\n## " end)
  if(NOT end EQUAL -1)
    string(SUBSTRING "${text}" 0 ${end} text)
  endif()
  string(STRIP "${text}" text)
  kova_scd_escape("${text}" text)
  string(REGEX REPLACE "`([^`]*)`" "*\\1*" text "${text}")
  set(${out} "${text}" PARENT_SCOPE)
endfunction()

# Fails unless the table holds every code the public headers define, with the same name and
# value, and no other.
function(kova_check_error_table include_dir)
  file(READ "${include_dir}/cred_request.h" request)
  file(READ "${include_dir}/kovaplatform.h" platform)
  string(REGEX MATCHALL "CRED_REQ_ERR_[A-Z_]+ = [0-9]+" defined "${request}")
  string(REGEX MATCHALL "KOVA_ERR_[A-Z_]+ 0x[0-9A-F]+ +// [0-9]+" store "${platform}")
  list(APPEND defined ${store})
  set(expected)
  foreach(entry IN LISTS defined)
    string(REGEX REPLACE "^([A-Z_]+) .* ([0-9]+)$" "\\2 \\1" entry "${entry}")
    if(NOT entry STREQUAL "0 CRED_REQ_ERR_NONE")
      list(APPEND expected "${entry}")
    endif()
  endforeach()
  set(listed)
  foreach(code name IN ZIP_LISTS CODES NAMES)
    list(APPEND listed "${code} ${name}")
  endforeach()
  list(SORT expected)
  list(SORT listed)
  if(NOT expected STREQUAL listed)
    message(FATAL_ERROR "${TABLE} does not match the headers' codes:\n  headers: ${expected}\n"
                        "  table: ${listed}")
  endif()
endfunction()

kova_read_error_table("${TABLE}")
list(LENGTH CODES count)
math(EXPR last "${count} - 1")

if(MODE STREQUAL "header")
  kova_check_error_table("${INCLUDE_DIR}")
  set(body "")
  foreach(i RANGE ${last})
    list(GET CODES ${i} code)
    list(GET NAMES ${i} name)
    list(GET MEANINGS ${i} meaning)
    string(REPLACE "\\" "\\\\" meaning "${meaning}")
    string(REPLACE "\"" "\\\"" meaning "${meaning}")
    string(APPEND body "    {${code}, \"${name}\", \"${meaning}\"},\n")
  endforeach()
  file(WRITE "${OUT}.tmp"
       "// Generated from doc/error-codes.txt by cmake/KovaDocs.cmake; edit the table instead.\n"
       "#ifndef KOVACRED_ERROR_TABLE_H\n#define KOVACRED_ERROR_TABLE_H\n\n"
       "namespace kovacred {\n\nstruct ErrorCodeEntry {\n    long code;\n"
       "    const char *name;\n    const char *meaning;\n};\n\n"
       "constexpr ErrorCodeEntry kErrorCodeTable[] = {\n${body}};\n\n"
       "}  // namespace kovacred\n\n#endif  // KOVACRED_ERROR_TABLE_H\n")
  file(COPY_FILE "${OUT}.tmp" "${OUT}" ONLY_IF_DIFFERENT)
  file(REMOVE "${OUT}.tmp")
elseif(MODE STREQUAL "man")
  set(table "")
  foreach(i RANGE ${last})
    list(GET CODES ${i} code)
    list(GET NAMES ${i} name)
    list(GET MEANINGS ${i} meaning)
    kova_scd_escape("${name}" name)
    kova_scd_escape("${meaning}" meaning)
    string(APPEND table "*${code}* ${name}\n\t${meaning}\n\n")
  endforeach()
  string(STRIP "${table}" table)
  kova_safety_guarantees("${README}" safety)
  file(READ "${SOURCE}" page)
  string(REPLACE "@ERROR_CODES@" "${table}" page "${page}")
  string(REPLACE "@SAFETY_GUARANTEES@" "${safety}" page "${page}")
  string(REPLACE "@VERSION@" "${VERSION}" page "${page}")
  get_filename_component(base "${OUT}" NAME_WLE)
  get_filename_component(dir "${OUT}" DIRECTORY)
  file(WRITE "${dir}/${base}.scd" "${page}")
  execute_process(COMMAND "${SCDOC}" INPUT_FILE "${dir}/${base}.scd" OUTPUT_FILE "${dir}/${base}"
                  ERROR_VARIABLE errors RESULT_VARIABLE rc)
  if(rc)
    message(FATAL_ERROR "scdoc failed on ${SOURCE}: ${errors}")
  endif()
  execute_process(COMMAND "${GZIP}" -9n -c "${dir}/${base}" OUTPUT_FILE "${OUT}" RESULT_VARIABLE rc)
  if(rc)
    message(FATAL_ERROR "gzip failed on ${dir}/${base}")
  endif()
else()
  message(FATAL_ERROR "MODE must be header or man")
endif()
