# Debian packages with CPack, one per install component:
#   libqorbu5     (runtime) the shared library
#   libqorbu-dev  (dev)     headers, pkg-config file, CMake package, libqorbu.so
#   qorbu-tools   (tools)   qorbu-shm and qorbu-demo, with their manual pages
# Build them from a tree configured with the prefix the packages install to:
#   cmake -S . -B build/deb -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
#         -DCMAKE_INSTALL_PREFIX=/usr -DQORBU_BUILD_TESTS=OFF
#   cmake --build build/deb && (cd build/deb && cpack -G DEB)
# The pkg-config file records the configured prefix, so the packages install
# to that same prefix. The objects in the packages are stripped; the build
# tree keeps them with their debug information.
# tests/packaging checks the packages with lintian.

set(CPACK_DEBIAN_RUNTIME_PACKAGE_NAME libqorbu5)
set(CPACK_DEBIAN_DEV_PACKAGE_NAME libqorbu-dev)
set(CPACK_DEBIAN_TOOLS_PACKAGE_NAME qorbu-tools)
set(CPACK_COMPONENTS_ALL runtime dev)
if(TARGET qorbu-shm)
  list(APPEND CPACK_COMPONENTS_ALL tools)
endif()

# --- manual pages and the Debian documents -----------------------------------
# Compressed the way Debian installs them: gzip -9n (no name, no time stamp).
find_program(QORBU_GZIP gzip REQUIRED)
set(qorbu_gzipped)
foreach(source IN ITEMS docs/man/qorbu-shm.1 docs/man/qorbu-demo.1 cmake/debian/changelog)
  get_filename_component(name ${source} NAME)
  get_filename_component(program ${source} NAME_WE)
  if(name MATCHES "\\.1$" AND NOT TARGET ${program})
    continue()
  endif()
  set(gzipped ${PROJECT_BINARY_DIR}/packaging/${name}.gz)
  add_custom_command(OUTPUT ${gzipped}
    COMMAND ${QORBU_GZIP} -9n -c ${PROJECT_SOURCE_DIR}/${source} > ${gzipped}
    DEPENDS ${PROJECT_SOURCE_DIR}/${source})
  list(APPEND qorbu_gzipped ${gzipped})
  if(name MATCHES "\\.1$")
    install(FILES ${gzipped} DESTINATION ${CMAKE_INSTALL_MANDIR}/man1 COMPONENT tools)
  endif()
endforeach()
add_custom_target(qorbu_packaging_documents ALL DEPENDS ${qorbu_gzipped})

# Each package carries the copyright file and the changelog; a plain
# `cmake --install` (no component named) leaves these Debian documents out.
foreach(component IN LISTS CPACK_COMPONENTS_ALL)
  string(TOUPPER ${component} upper)
  install(FILES ${PROJECT_SOURCE_DIR}/cmake/debian/copyright ${PROJECT_BINARY_DIR}/packaging/changelog.gz
          DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/doc/${CPACK_DEBIAN_${upper}_PACKAGE_NAME}
          COMPONENT ${component} EXCLUDE_FROM_ALL)
endforeach()

# --- CPack --------------------------------------------------------------------
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME qorbu)
set(CPACK_PACKAGE_VENDOR "libqorbu developers")
set(CPACK_PACKAGE_CONTACT "libqorbu developers <qorbu-dev@lists.qorbu.org>")
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
# No CPACK_PACKAGE_DESCRIPTION_SUMMARY: CPack would put it in front of every
# package's description; the first line of each description below is its
# synopsis.
set(CPACK_PACKAGING_INSTALL_PREFIX ${CMAKE_INSTALL_PREFIX})
set(CPACK_PACKAGE_DIRECTORY ${PROJECT_BINARY_DIR}/packages)

set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_STRIP_FILES ON)
# Dependencies on system libraries are computed by dpkg-shlibdeps: by CPack
# for the programs (libqorbu.so.5 itself is found in the build tree and
# depended on explicitly below), by cmake/debian/cpack-project.cmake for the
# library.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_RUNTIME_PACKAGE_SHLIBDEPS OFF)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS ${PROJECT_BINARY_DIR})
set(CPACK_PROJECT_CONFIG_FILE ${PROJECT_SOURCE_DIR}/cmake/debian/cpack-project.cmake)
set(CPACK_QORBU_LIBRARY ${PROJECT_BINARY_DIR}/libqorbu.so.${PROJECT_VERSION_MAJOR})
set(CPACK_QORBU_PACKAGING_DIR ${PROJECT_BINARY_DIR}/packaging)

# The Debian architecture of the target, cross builds included.
if(CMAKE_SYSTEM_PROCESSOR MATCHES "^(arm|ARM)")
  set(CPACK_DEBIAN_PACKAGE_ARCHITECTURE armhf)
elseif(CMAKE_SYSTEM_PROCESSOR MATCHES "^i[3-6]86$")
  set(CPACK_DEBIAN_PACKAGE_ARCHITECTURE i386)
elseif(CMAKE_SYSTEM_PROCESSOR MATCHES "^(x86_64|AMD64|amd64)$")
  set(CPACK_DEBIAN_PACKAGE_ARCHITECTURE amd64)
endif()

set(qorbu_exact "(= ${PROJECT_VERSION})")

# The library: a shlibs file, so that packages built against it depend on
# libqorbu5 of at least this version, and the ldconfig trigger.
file(WRITE ${PROJECT_BINARY_DIR}/packaging/shlibs
     "libqorbu ${PROJECT_VERSION_MAJOR} libqorbu5 (>= ${PROJECT_VERSION})\n")
set(CPACK_DEBIAN_RUNTIME_PACKAGE_CONTROL_EXTRA
    ${PROJECT_BINARY_DIR}/packaging/shlibs ${PROJECT_SOURCE_DIR}/cmake/debian/triggers)
set(CPACK_DEBIAN_RUNTIME_DESCRIPTION
    "event loop, shared-memory allocator and green threads for daemons\nThe event selector (select and epoll loops, timers, signals), named\nshared-memory segments with a buddy allocator, cooperative green threads\nand blocking-style descriptor calls for them.")

set(CPACK_DEBIAN_DEV_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_DEV_PACKAGE_DEPENDS "libqorbu5 ${qorbu_exact}")
set(CPACK_DEBIAN_DEV_DESCRIPTION
    "development files for libqorbu\nHeaders, the libqorbu.so link, a pkg-config file (qorbu) and a CMake\npackage (find_package(qorbu), target qorbu::qorbu).")

set(CPACK_DEBIAN_TOOLS_PACKAGE_SECTION utils)
set(CPACK_DEBIAN_TOOLS_PACKAGE_DEPENDS "libqorbu5 ${qorbu_exact}")
if(TARGET qorbu-demo)
  set(CPACK_DEBIAN_TOOLS_PACKAGE_RECOMMENDS "snmp")
endif()
set(CPACK_DEBIAN_TOOLS_DESCRIPTION
    "segment tool and demo host daemon for libqorbu\nqorbu-shm creates, inspects and removes shared segments; qorbu-demo is\na demo host daemon (TCP echo in green threads, an SNMP agent, records in\na shared segment) with a self-test.")

include(CPack)
