// Data objects the host's other components expect to find in this library.
// The library itself never reads or writes them.
#include "selector/sel_private.h"

extern "C" {
QORBU_API void *com2SecList = nullptr;
QORBU_API void *com2SecListLast = nullptr;
QORBU_API void *g_protocols_list = nullptr;
QORBU_API void *g_services_list = nullptr;
}
