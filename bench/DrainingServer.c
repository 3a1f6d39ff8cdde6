#include "bench/DrainingServer.h"

#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

enum { kMostConnections = 64 };

static char directory[] = "/tmp/velk-bench-XXXXXX";
static char path[64];

static void drain(int listener) {
  static char bytes[1 << 18];
  struct pollfd sources[1 + kMostConnections] = {{listener, POLLIN, 0}};
  nfds_t count = 1;
  while (poll(sources, count, -1) > 0) {
    for (nfds_t at = count - 1; at > 0; --at) {
      if (sources[at].revents == 0 || read(sources[at].fd, bytes, sizeof bytes) > 0) continue;
      close(sources[at].fd);
      sources[at] = sources[--count];
    }
    if (sources[0].revents == 0) continue;
    const int connection = accept(listener, NULL, NULL);
    if (connection < 0) continue;
    if (count > kMostConnections) {
      close(connection);
      continue;
    }
    sources[count++] = (struct pollfd){connection, POLLIN, 0};
  }
}

pid_t startDrainingServer(void) {
  if (mkdtemp(directory) == NULL) return -1;
  snprintf(path, sizeof path, "%s/socket", directory);
  struct sockaddr_un address = {.sun_family = AF_UNIX};
  strncpy(address.sun_path, path, sizeof address.sun_path - 1);
  const int listener = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (bind(listener, (const struct sockaddr*)&address, sizeof address) != 0 || listen(listener, 64) != 0) return -1;
  const pid_t server = fork();
  if (server == 0) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    drain(listener);
    _exit(0);
  }
  close(listener);
  setenv("VELKREPORTING_SOCKET", path, 1);
  return server;
}

void stopDrainingServer(pid_t server) {
  kill(server, SIGKILL);
  waitpid(server, NULL, 0);
  unlink(path);
  rmdir(directory);
}
