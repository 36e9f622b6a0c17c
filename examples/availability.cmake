# Whether this configuration builds qorbu-demo. Included by examples/ and by
# tests/demo/ (which CMake reads first), so both decide alike.
#   QORBU_DEMO_AVAILABLE   ON or OFF
#   QORBU_DEMO_MISSING     why not, for a status message

# Net-SNMP's headers and libraries, found without `net-snmp-config --cflags`:
# its large-file flags would give the demo another off_t than the library.
find_path(QORBU_NETSNMP_INCLUDE_DIR net-snmp/agent/net-snmp-agent-includes.h)
find_library(QORBU_NETSNMPAGENT_LIBRARY netsnmpagent)
find_library(QORBU_NETSNMP_LIBRARY netsnmp)

set(QORBU_DEMO_AVAILABLE OFF)
if(CMAKE_CROSSCOMPILING)
  set(QORBU_DEMO_MISSING "a native build")
elseif(NOT QORBU_NETSNMP_INCLUDE_DIR OR NOT QORBU_NETSNMPAGENT_LIBRARY OR NOT QORBU_NETSNMP_LIBRARY)
  set(QORBU_DEMO_MISSING "Net-SNMP (apt-get install libsnmp-dev)")
else()
  set(QORBU_DEMO_AVAILABLE ON)
endif()
