# CPack runs this after it built the packages. CPack gives a package with a library under
# /usr/lib a postinst and a postrm that call ldconfig; dpkg's ldconfig trigger (doc/deb/triggers)
# does that already, and Debian wants the trigger alone (lintian: maintscript-calls-ldconfig).
# CPack has no switch for it, so the library package is rebuilt here without the two scripts;
# its files and other control files stay as they are.
foreach(deb IN LISTS CPACK_PACKAGE_FILES)
  get_filename_component(name ${deb} NAME)
  if(NOT name MATCHES "^libkovacredential6_.*\\.deb$")
    continue()
  endif()
  set(root ${CPACK_TOPLEVEL_DIRECTORY}/libkovacredential6-repack)
  file(REMOVE_RECURSE ${root})
  execute_process(COMMAND dpkg-deb -R ${deb} ${root} RESULT_VARIABLE rc)
  if(rc)
    message(FATAL_ERROR "cannot unpack ${deb}")
  endif()
  file(REMOVE ${root}/DEBIAN/postinst ${root}/DEBIAN/postrm)
  execute_process(COMMAND dpkg-deb --root-owner-group -b ${root} ${deb} RESULT_VARIABLE rc
                  OUTPUT_QUIET)
  if(rc)
    message(FATAL_ERROR "cannot rebuild ${deb}")
  endif()
  file(REMOVE_RECURSE ${root})
endforeach()
