/* libqorbu blocking-style descriptor calls for green threads. The
 * descriptors must be non-blocking; a call that would block parks the
 * calling green thread in the selector until the descriptor is ready. */
#ifndef QORBU_NBIO_NB_H
#define QORBU_NBIO_NB_H

#include <stddef.h>
#include <sys/socket.h>

#include "qorbu_api.h"

#ifdef __cplusplus
extern "C" {
#endif

QORBU_API int nb_poll(int fd, int events, int timeout);
QORBU_API int nb_accept(int fd, struct sockaddr *addr, socklen_t *addrlen);
QORBU_API int nb_connect(int fd, const struct sockaddr *addr, socklen_t addrlen);
QORBU_API int nb_read(int fd, void *buf, size_t len);
QORBU_API int nb_readall(int fd, void *buf, size_t len);
QORBU_API int nb_write(int fd, const void *buf, size_t len);

#ifdef __cplusplus
}
#endif

#endif
