# Builds the consumer against an installed library, through the CMake package and through the
# pkg-config file, and runs both. Without PREFIX the build tree is first installed into a
# scratch prefix; with PREFIX (and LIBDIR, relative to it) the files already there are used,
# such as an unpacked -dev package. WORK names the scratch folder (default: in BINARY_DIR).
include(${CMAKE_CURRENT_LIST_DIR}/../support/subproject.cmake)
if(NOT WORK)
  set(WORK ${BINARY_DIR})
endif()
set(build ${WORK}/consumer-build)
if(PREFIX)
  set(prefix ${PREFIX})
  set(libdir ${LIBDIR})
else()
  set(prefix ${WORK}/consumer-prefix)
  set(libdir lib)
  set(tools bin/kovacred bin/kovasim)
  file(REMOVE_RECURSE ${prefix})
  execute_process(COMMAND ${CMAKE_COMMAND} --install ${BINARY_DIR} --prefix ${prefix}
                  RESULT_VARIABLE rc OUTPUT_QUIET)
  if(rc)
    message(FATAL_ERROR "install failed: ${rc}")
  endif()
endif()
file(REMOVE_RECURSE ${build})
foreach(f include/kovacredential/kovacredential.h ${libdir}/libkovacredential.so.6
          ${libdir}/libkovacredential.so ${libdir}/pkgconfig/kovacredential.pc
          ${libdir}/cmake/KovaCredential/KovaCredentialConfig.cmake ${tools})
  if(NOT EXISTS ${prefix}/${f})
    message(FATAL_ERROR "not installed: ${f}")
  endif()
endforeach()
set(ENV{PKG_CONFIG_PATH} ${prefix}/${libdir}/pkgconfig)
# A cross build searches only below its find roots, so the prefix becomes one.
kova_configure_subproject(${SOURCE_DIR}/tests/consumer ${build} -DCMAKE_PREFIX_PATH=${prefix}
                          -DCMAKE_FIND_ROOT_PATH=${prefix} -DCMAKE_INSTALL_LIBDIR=${libdir})
execute_process(COMMAND ${CMAKE_COMMAND} --build ${build} RESULT_VARIABLE rc)
if(rc)
  message(FATAL_ERROR "consumer build failed")
endif()
set(ENV{LD_LIBRARY_PATH} ${prefix}/${libdir})
foreach(exe consumer consumer_pc)
  file(REMOVE ${build}/${exe}.sqlite)
  kova_run_target_program(${build}/${exe} ${build}/${exe}.sqlite)
endforeach()
