# Debian packages with CPack, one per install component:
#   libqorbu5     (runtime) the shared library
#   libqorbu-dev  (dev)     headers, pkg-config file, CMake package, libqorbu.so
#   qorbu-tools   (tools)   qorbu-shm and qorbu-demo
# Build them from a tree configured with the prefix the packages install to:
#   cmake -S . -B build/deb -G Ninja -DCMAKE_INSTALL_PREFIX=/usr -DQORBU_BUILD_TESTS=OFF
#   cmake --build build/deb && (cd build/deb && cpack -G DEB)
# The pkg-config file records the configured prefix, so the packages install
# to that same prefix.

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME qorbu)
set(CPACK_PACKAGE_VENDOR "libqorbu developers")
set(CPACK_PACKAGE_CONTACT "libqorbu developers <qorbu@localhost>")
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY
    "Event selector, shared-memory allocator and green threads for long-running daemons")
set(CPACK_PACKAGING_INSTALL_PREFIX ${CMAKE_INSTALL_PREFIX})
set(CPACK_PACKAGE_DIRECTORY ${PROJECT_BINARY_DIR}/packages)

set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_ALL runtime dev tools)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)

# The Debian architecture of the target, cross builds included.
if(CMAKE_SYSTEM_PROCESSOR MATCHES "^(arm|ARM)")
  set(CPACK_DEBIAN_PACKAGE_ARCHITECTURE armhf)
elseif(CMAKE_SYSTEM_PROCESSOR MATCHES "^i[3-6]86$")
  set(CPACK_DEBIAN_PACKAGE_ARCHITECTURE i386)
elseif(CMAKE_SYSTEM_PROCESSOR MATCHES "^(x86_64|AMD64|amd64)$")
  set(CPACK_DEBIAN_PACKAGE_ARCHITECTURE amd64)
endif()

set(qorbu_exact "(= ${PROJECT_VERSION})")

set(CPACK_DEBIAN_RUNTIME_PACKAGE_NAME libqorbu5)
set(CPACK_DEBIAN_RUNTIME_PACKAGE_DEPENDS "libc6 (>= 2.34)")
set(CPACK_DEBIAN_RUNTIME_DESCRIPTION
    "libqorbu shared library\nThe event selector (select and epoll loops, timers, signals), named\nshared-memory segments with a buddy allocator, cooperative green threads\nand blocking-style descriptor calls for them.")

set(CPACK_DEBIAN_DEV_PACKAGE_NAME libqorbu-dev)
set(CPACK_DEBIAN_DEV_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_DEV_PACKAGE_DEPENDS "libqorbu5 ${qorbu_exact}")
set(CPACK_DEBIAN_DEV_DESCRIPTION
    "libqorbu development files\nHeaders, the libqorbu.so link, a pkg-config file (qorbu) and a CMake\npackage (find_package(qorbu), target qorbu::qorbu).")

set(CPACK_DEBIAN_TOOLS_PACKAGE_NAME qorbu-tools)
set(CPACK_DEBIAN_TOOLS_PACKAGE_SECTION utils)
if(TARGET qorbu-demo)
  set(CPACK_DEBIAN_TOOLS_PACKAGE_DEPENDS "libqorbu5 ${qorbu_exact}, libsnmp40")
  set(CPACK_DEBIAN_TOOLS_PACKAGE_RECOMMENDS "snmp")
else()
  set(CPACK_DEBIAN_TOOLS_PACKAGE_DEPENDS "libqorbu5 ${qorbu_exact}")
endif()
set(CPACK_DEBIAN_TOOLS_DESCRIPTION
    "libqorbu tools\nqorbu-shm creates, inspects and removes shared segments; qorbu-demo is\na demo host daemon (TCP echo in green threads, an SNMP agent, records in\na shared segment) with a self-test.")

include(CPack)
