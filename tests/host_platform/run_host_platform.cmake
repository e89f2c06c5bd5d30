# Builds the library with KOVA_BUNDLED_PLATFORM=OFF against HOST_LIBRARY, a stand-in for the
# host's own libraries, checks that the library leaves the host services to it, and runs the
# store tests (kovacred's included, which go through the shared library) on that build. The
# build folder is kept, so later runs only rebuild what changed.
include(${CMAKE_CURRENT_LIST_DIR}/../support/subproject.cmake)
set(build ${BINARY_DIR}/host-platform-build)
kova_configure_subproject(${SOURCE_DIR} ${build} -DKOVA_BUNDLED_PLATFORM=OFF
                          -DKOVA_PLATFORM_LIBRARIES=${HOST_LIBRARY} -DKOVA_WERROR=ON
                          -DKOVA_BUILD_BENCH=OFF -DCMAKE_GTEST_DISCOVER_TESTS_DISCOVERY_MODE=PRE_TEST)
set(store_tests store_records_test store_database_test store_interface_test store_concurrency_test
    kovacred_cli_test)
execute_process(COMMAND ${CMAKE_COMMAND} --build ${build} --target kovacredential ${store_tests}
                RESULT_VARIABLE rc)
if(rc)
  message(FATAL_ERROR "building the host-platform library and store tests failed")
endif()

load_cache(${build} READ_WITH_PREFIX sub_ CMAKE_NM)
file(GLOB library ${build}/libkovacredential.so.*.*.*)
execute_process(COMMAND ${sub_CMAKE_NM} -D -C --defined-only ${library} OUTPUT_VARIABLE defined
                RESULT_VARIABLE rc_defined)
execute_process(COMMAND ${sub_CMAKE_NM} -D -C --undefined-only ${library}
                OUTPUT_VARIABLE undefined RESULT_VARIABLE rc_undefined)
if(rc_defined OR rc_undefined)
  message(FATAL_ERROR "${sub_CMAKE_NM} cannot read ${library}")
endif()
# What the library calls must be left undefined for the host; the rest it must not define.
set(called VLIBCErrSetEx VLIBCErrGet VLIBCErrorGetFile VLIBCErrorGetLine VLIBCFileTouch
    VLIBCBase64SzEncodeFull VLIBCBase64Decode KOVACloudServiceHxtokenGetToken KOVANetGetAddrType
    "KOVA::WebAPIUtil::URLEncode" "KOVA::WebAPIUtil::JsonObjTostrPair")
foreach(symbol ${called} KOVACloudServiceHxtokenSetProvider)
  if(defined MATCHES " ${symbol}(\\(|\n)")
    message(FATAL_ERROR "the library defines the host symbol ${symbol}")
  endif()
endforeach()
foreach(symbol ${called})
  if(NOT undefined MATCHES " ${symbol}(\\(|\n)")
    message(FATAL_ERROR "the library does not leave ${symbol} to the host")
  endif()
endforeach()

foreach(test ${store_tests})
  kova_run_target_program(${build}/tests/${test})
endforeach()
