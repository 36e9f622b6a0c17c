/* Every public header, compiled as strict ISO C with no feature macros. */
#include <greenthreads/greenthread.h>
#include <nbio/nb.h>
#include <selector/host.h>
#include <selector/sel.h>
#include <shm/shm.h>

typedef char sel_timer_has_fields[sizeof(((SelTimer *)0)->when) > 0 ? 1 : -1];
