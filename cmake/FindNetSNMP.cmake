# Net-SNMP's agent library, for the demo host and the test of the select loop
# servicing it (Debian: libsnmp-dev; snmpget is in snmp). Its headers and
# libraries are found by name, without `net-snmp-config --cflags`: its
# large-file flags would give its users another off_t than the library.
#   NetSNMP_FOUND, the imported target NetSNMP::agent, and NetSNMP_SNMPGET
#   (the snmpget program, or NOTFOUND; it is not required).
find_path(NetSNMP_INCLUDE_DIR net-snmp/agent/net-snmp-agent-includes.h)
find_library(NetSNMP_LIBRARY netsnmp)
find_library(NetSNMP_AGENT_LIBRARY netsnmpagent)
find_program(NetSNMP_SNMPGET snmpget)

include(FindPackageHandleStandardArgs)
find_package_handle_standard_args(NetSNMP
  REQUIRED_VARS NetSNMP_INCLUDE_DIR NetSNMP_AGENT_LIBRARY NetSNMP_LIBRARY)
if(NetSNMP_FOUND AND NOT TARGET NetSNMP::agent)
  add_library(NetSNMP::agent INTERFACE IMPORTED)
  set_target_properties(NetSNMP::agent PROPERTIES
    INTERFACE_INCLUDE_DIRECTORIES ${NetSNMP_INCLUDE_DIR}
    INTERFACE_LINK_LIBRARIES "${NetSNMP_AGENT_LIBRARY};${NetSNMP_LIBRARY}")
endif()
