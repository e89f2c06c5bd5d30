# Helpers of the test scripts that configure, build and run a sub-project. The sub-project is
# built for the same machine as the enclosing build: the scripts receive GENERATOR,
# BUILD_TYPE, TOOLCHAIN_FILE, KOVA_SYSROOT and COMPILER_LAUNCHER from it (empty when unused),
# and run what they built behind KOVA_TEST_LAUNCHER (the emulator of a cross build).

# Configures the project in `source` into `build` with the enclosing build's settings and the
# extra arguments given.
function(kova_configure_subproject source build)
  set(args -S ${source} -B ${build})
  if(GENERATOR)
    list(APPEND args -G ${GENERATOR})
  endif()
  if(BUILD_TYPE)
    list(APPEND args -DCMAKE_BUILD_TYPE=${BUILD_TYPE})
  endif()
  if(TOOLCHAIN_FILE)
    list(APPEND args -DCMAKE_TOOLCHAIN_FILE=${TOOLCHAIN_FILE} -DKOVA_SYSROOT=${KOVA_SYSROOT})
  endif()
  if(COMPILER_LAUNCHER)
    list(APPEND args -DCMAKE_C_COMPILER_LAUNCHER=${COMPILER_LAUNCHER}
         -DCMAKE_CXX_COMPILER_LAUNCHER=${COMPILER_LAUNCHER})
  endif()
  execute_process(COMMAND ${CMAKE_COMMAND} ${args} ${ARGN} RESULT_VARIABLE rc)
  if(rc)
    message(FATAL_ERROR "configuring ${source} in ${build} failed")
  endif()
endfunction()

# Runs a program built for the target machine with its arguments; fails the script unless it
# exits with 0.
function(kova_run_target_program program)
  separate_arguments(launcher UNIX_COMMAND "$ENV{KOVA_TEST_LAUNCHER}")
  execute_process(COMMAND ${launcher} ${program} ${ARGN} RESULT_VARIABLE rc)
  if(NOT rc EQUAL 0)
    message(FATAL_ERROR "${program} failed: ${rc}")
  endif()
endfunction()
