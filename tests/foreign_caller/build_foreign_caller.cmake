# Configures and builds the foreign-caller programs in WORK/foreign-caller-build like the
# enclosing build (see tests/support/subproject.cmake); the test runs them.
include(${CMAKE_CURRENT_LIST_DIR}/../support/subproject.cmake)
set(build ${WORK}/foreign-caller-build)
file(REMOVE_RECURSE ${build})
kova_configure_subproject(${CMAKE_CURRENT_LIST_DIR} ${build})
execute_process(COMMAND ${CMAKE_COMMAND} --build ${build} RESULT_VARIABLE rc)
if(rc)
  message(FATAL_ERROR "foreign-caller build failed")
endif()
