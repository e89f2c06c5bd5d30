# Installs the built library into a scratch prefix, builds the consumer against the CMake
# package and the pkg-config file, and runs both.
include(${CMAKE_CURRENT_LIST_DIR}/../support/subproject.cmake)
set(prefix ${BINARY_DIR}/consumer-prefix)
set(build ${BINARY_DIR}/consumer-build)
file(REMOVE_RECURSE ${prefix} ${build})
execute_process(COMMAND ${CMAKE_COMMAND} --install ${BINARY_DIR} --prefix ${prefix}
                RESULT_VARIABLE rc OUTPUT_QUIET)
if(rc)
  message(FATAL_ERROR "install failed: ${rc}")
endif()
foreach(f include/kovacredential/kovacredential.h lib/libkovacredential.so.6
          lib/pkgconfig/kovacredential.pc lib/cmake/KovaCredential/KovaCredentialConfig.cmake
          bin/kovacred)
  if(NOT EXISTS ${prefix}/${f})
    message(FATAL_ERROR "not installed: ${f}")
  endif()
endforeach()
set(ENV{PKG_CONFIG_PATH} ${prefix}/lib/pkgconfig)
# A cross build searches only below its find roots, so the prefix becomes one.
kova_configure_subproject(${SOURCE_DIR}/tests/consumer ${build} -DCMAKE_PREFIX_PATH=${prefix}
                          -DCMAKE_FIND_ROOT_PATH=${prefix} -DCMAKE_INSTALL_LIBDIR=lib)
execute_process(COMMAND ${CMAKE_COMMAND} --build ${build} RESULT_VARIABLE rc)
if(rc)
  message(FATAL_ERROR "consumer build failed")
endif()
set(ENV{LD_LIBRARY_PATH} ${prefix}/lib)
foreach(exe consumer consumer_pc)
  file(REMOVE ${build}/${exe}.sqlite)
  kova_run_target_program(${build}/${exe} ${build}/${exe}.sqlite)
endforeach()
