/* A daemon in name only: a child process that takes whatever comes over its socket at once and does nothing with it, so
 * that what is measured is the library. */
#ifndef VELK_BENCH_DRAINING_SERVER_H
#define VELK_BENCH_DRAINING_SERVER_H

#include <sys/types.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Listens in a new directory under /tmp, and has VELKREPORTING_SOCKET name the socket. Its process, or -1. */
pid_t startDrainingServer(void);
/* Ends it and removes its directory. */
void stopDrainingServer(pid_t server);

#ifdef __cplusplus
}
#endif

#endif
