# Whether this configuration builds qorbu-demo. Included by examples/ and by
# tests/demo/ (which CMake reads first), so both decide alike.
#   QORBU_DEMO_AVAILABLE   ON or OFF
#   QORBU_DEMO_MISSING     why not, for a status message

# Net-SNMP's headers and libraries, found without `net-snmp-config --cflags`:
# its large-file flags would give the demo another off_t than the library.
find_path(QORBU_NETSNMP_INCLUDE_DIR net-snmp/agent/net-snmp-agent-includes.h)
find_library(QORBU_NETSNMPAGENT_LIBRARY netsnmpagent)
find_library(QORBU_NETSNMP_LIBRARY netsnmp)

# Until every facility the demo uses is in the tree, the demo is left out
# rather than breaking the build: a function counts as present when some
# library source defines it at the start of a line.
function(qorbu_library_lacks out)
  file(GLOB sources ${PROJECT_SOURCE_DIR}/selector/*.cpp ${PROJECT_SOURCE_DIR}/shm/*.cpp
       ${PROJECT_SOURCE_DIR}/greenthreads/*.cpp ${PROJECT_SOURCE_DIR}/nbio/*.cpp)
  set(missing "")
  foreach(fn ${ARGN})
    set(found FALSE)
    foreach(src ${sources})
      file(STRINGS ${src} hits REGEX "^[A-Za-z_].*[ *]${fn}\\([^;]*$")
      if(hits)
        set(found TRUE)
        break()
      endif()
    endforeach()
    if(NOT found)
      list(APPEND missing ${fn})
    endif()
  endforeach()
  set(${out} "${missing}" PARENT_SCOPE)
endfunction()

set(QORBU_DEMO_AVAILABLE OFF)
if(CMAKE_CROSSCOMPILING)
  set(QORBU_DEMO_MISSING "a native build")
elseif(NOT QORBU_NETSNMP_INCLUDE_DIR OR NOT QORBU_NETSNMPAGENT_LIBRARY OR NOT QORBU_NETSNMP_LIBRARY)
  set(QORBU_DEMO_MISSING "Net-SNMP (apt-get install libsnmp-dev)")
else()
  qorbu_library_lacks(QORBU_DEMO_MISSING SelInit SelSelect ShmCreate ShmAlloc greenthreads_run nb_accept)
  if(NOT QORBU_DEMO_MISSING)
    set(QORBU_DEMO_AVAILABLE ON)
  endif()
endif()

set(QORBU_SHM_TOOL_AVAILABLE OFF)
qorbu_library_lacks(QORBU_SHM_TOOL_MISSING ShmCreate ShmOpen ShmAlloc ShmPrintFree)
if(NOT QORBU_SHM_TOOL_MISSING)
  set(QORBU_SHM_TOOL_AVAILABLE ON)
endif()
