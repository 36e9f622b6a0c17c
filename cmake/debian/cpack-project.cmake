# Read by cpack (CPACK_PROJECT_CONFIG_FILE) once the tree is built.
#
# libqorbu5's dependencies come from dpkg-shlibdeps, run here on the built
# library rather than by CPack: CPack's own run would also give the package
# postinst and postrm scripts that call ldconfig, where Debian wants the
# package's ldconfig trigger (cmake/debian/triggers) alone.
if(CPACK_GENERATOR STREQUAL "DEB" AND NOT CPACK_DEBIAN_RUNTIME_PACKAGE_DEPENDS)
  find_program(qorbu_shlibdeps dpkg-shlibdeps)
  set(qorbu_work ${CPACK_QORBU_PACKAGING_DIR}/shlibdeps)
  file(REMOVE_RECURSE ${qorbu_work})
  file(WRITE ${qorbu_work}/debian/control "")
  if(qorbu_shlibdeps)
    execute_process(COMMAND ${qorbu_shlibdeps} -O ${CPACK_QORBU_LIBRARY}
                    WORKING_DIRECTORY ${qorbu_work}
                    OUTPUT_VARIABLE qorbu_depends ERROR_VARIABLE qorbu_error
                    RESULT_VARIABLE qorbu_result OUTPUT_STRIP_TRAILING_WHITESPACE)
  endif()
  file(REMOVE_RECURSE ${qorbu_work})
  if(qorbu_shlibdeps AND qorbu_result EQUAL 0 AND qorbu_depends MATCHES "shlibs:Depends=(.+)")
    set(CPACK_DEBIAN_RUNTIME_PACKAGE_DEPENDS "${CMAKE_MATCH_1}")
  else()
    message(WARNING "dpkg-shlibdeps gave no dependencies for ${CPACK_QORBU_LIBRARY} "
                    "(${qorbu_error}); libqorbu5 depends on libc6 without a version")
    set(CPACK_DEBIAN_RUNTIME_PACKAGE_DEPENDS "libc6")
  endif()
endif()
