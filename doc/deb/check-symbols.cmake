# CPack runs this after installing the packages' files into its staging folder and before it
# builds them. For the library package it does what dpkg-gensymbols does in a Debian package
# build: it compares the exported symbols of the staged libkovacredential.so.6 with the
# checked-in doc/deb/libkovacredential6.symbols and fails the package build when a symbol listed
# there is missing (removed, or changed, which C++ mangling turns into missing plus new). New
# symbols pass (level 1 of -c); the symbols file it writes, with them, is the one the package
# carries.
if(NOT CPACK_KOVA_SYMBOLS_TEMPLATE)
  return()
endif()
file(GLOB_RECURSE library ${CPACK_TEMPORARY_INSTALL_DIRECTORY}/libkovacredential.so.6)
if(NOT library)
  message(FATAL_ERROR "libkovacredential.so.6 is not staged in ${CPACK_TEMPORARY_INSTALL_DIRECTORY}")
endif()
list(GET library 0 library)
get_filename_component(out_dir ${CPACK_KOVA_SYMBOLS_OUTPUT} DIRECTORY)
file(MAKE_DIRECTORY ${out_dir})
# dpkg-gensymbols reads the source package's name from a control file in the current folder.
file(WRITE ${out_dir}/control "Source: libkovacredential\n\nPackage: libkovacredential6\n")
execute_process(
  COMMAND dpkg-gensymbols -plibkovacredential6 -v${CPACK_PACKAGE_VERSION}
          -a${CPACK_DEBIAN_PACKAGE_ARCHITECTURE} -e${library} -I${CPACK_KOVA_SYMBOLS_TEMPLATE}
          -O${CPACK_KOVA_SYMBOLS_OUTPUT} -c1
  WORKING_DIRECTORY ${out_dir}
  RESULT_VARIABLE rc)
if(rc)
  message(FATAL_ERROR "libkovacredential.so.6 lost symbols of ${CPACK_KOVA_SYMBOLS_TEMPLATE} "
                      "(dpkg-gensymbols, above)")
endif()
