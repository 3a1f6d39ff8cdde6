/* What the library costs a process that has nothing else: time, threads and memory of each step from an empty process
 * to a client that has sent events. Each of the runs is a process of its own; the medians are shown.
 *
 *   bench_footprint LIBRARY [RUNS] */
#include <dirent.h>
#include <dlfcn.h>
#include <stdbool.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include "bench/DrainingServer.h"
#include "client/VelkReportingC.h"

enum { kSteps = 6, kFigures = 4, kMostRuns = 1000, kEvents = 1000 };

static const char* const kNames[kSteps] = {"empty process",  "C++ runtime loaded", "library loaded",
                                           "client created", "1,000 events sent",  "client released"};

/* Microseconds that the step took; threads, resident and private dirty KiB after it. */
typedef struct {
  double figures[kSteps][kFigures];
} Run;

static double microseconds(void) {
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return (double)now.tv_sec * 1e6 + (double)now.tv_nsec / 1e3;
}

static double threads(void) {
  DIR* tasks = opendir("/proc/self/task");
  int count = -2;
  while (readdir(tasks) != NULL) ++count;
  closedir(tasks);
  return count;
}

static void look(Run* run, int step, double begun) {
  run->figures[step][0] = microseconds() - begun;
  run->figures[step][1] = threads();
  FILE* file = fopen("/proc/self/smaps_rollup", "r");
  char line[256];
  while (file != NULL && fgets(line, sizeof line, file) != NULL) {
    sscanf(line, "Rss: %lf", &run->figures[step][2]);
    sscanf(line, "Private_Dirty: %lf", &run->figures[step][3]);
  }
  if (file != NULL) fclose(file);
}

static void* symbol(void* library, const char* name) {
  void* found = dlsym(library, name);
  if (found == NULL) _exit(70);
  return found;
}

static void measure(const char* path, Run* run) {
  double begun = microseconds();
  look(run, 0, begun);
  begun = microseconds();
  if (dlopen("libstdc++.so.6", RTLD_NOW | RTLD_GLOBAL) == NULL) _exit(69);
  look(run, 1, begun);
  begun = microseconds();
  void* library = dlopen(path, RTLD_NOW);
  if (library == NULL) _exit(69);
  look(run, 2, begun);
  VelkReportingValue* (*parse)(const char*, VelkReportingError**);
  VelkReportingClient* (*create)(const VelkReportingValue*, const VelkReportingValue*, const VelkReportingValue*);
  bool (*send)(VelkReportingClient*, uint16_t, uint16_t, const VelkReportingValue*, VelkReportingError**);
  void (*release)(VelkReportingClient*);
  *(void**)&parse = symbol(library, "VelkReportingDictionaryCreateFromJSON");
  *(void**)&create = symbol(library, "VelkReportingClientCreate");
  *(void**)&send = symbol(library, "VelkReportingSendMessageWithError");
  *(void**)&release = symbol(library, "VelkReportingClientRelease");
  begun = microseconds();
  VelkReportingClient* client =
      create(parse("{\"ComponentType\": 9, \"ClientVersion\": 3, \"SessionID\": 1}", NULL),
             parse("{\"_clientName\": \"Bench\", \"_serviceName\": \"footprint\"}", NULL), NULL);
  look(run, 3, begun);
  VelkReportingValue* payload = parse("{\"free\": 123456, \"used\": 654321, \"name\": \"volume\"}", NULL);
  begun = microseconds();
  for (int event = 0; event < kEvents; ++event) send(client, 2, 1, payload, NULL);
  look(run, 4, begun);
  begun = microseconds();
  release(client);
  look(run, 5, begun);
}

static int compare(const void* left, const void* right) {
  const double difference = *(const double*)left - *(const double*)right;
  return (difference > 0) - (difference < 0);
}

static double median(const Run* runs, int count, int step, int figure) {
  static double sorted[kMostRuns];
  for (int run = 0; run < count; ++run) sorted[run] = runs[run].figures[step][figure];
  qsort(sorted, (size_t)count, sizeof sorted[0], compare);
  return sorted[count / 2];
}

int main(int argc, char** argv) {
  static Run runs[kMostRuns];
  const int count = argc > 2 ? atoi(argv[2]) : 21;
  if (argc < 2 || count < 1 || count > kMostRuns) return 64;
  const pid_t server = startDrainingServer();
  if (server < 0) return 70;
  int status = 0;
  for (int run = 0; run < count && status == 0; ++run) {
    int ends[2];
    if (pipe(ends) != 0) return 71;
    const pid_t child = fork();
    if (child == 0) {
      Run measured;
      memset(&measured, 0, sizeof measured);
      measure(argv[1], &measured);
      _exit(write(ends[1], &measured, sizeof measured) == (ssize_t)sizeof measured ? 0 : 71);
    }
    close(ends[1]);
    if (read(ends[0], &runs[run], sizeof runs[run]) != (ssize_t)sizeof runs[run]) status = 71;
    close(ends[0]);
    waitpid(child, NULL, 0);
  }
  stopDrainingServer(server);
  if (status != 0) return status;
  printf("%-20s | %9s | %7s | %12s | %17s\n", "step", "us", "threads", "resident KiB", "private dirty KiB");
  for (int step = 0; step < kSteps; ++step) {
    printf("%-20s | %9.0f | %7.0f | %12.0f | %17.0f\n", kNames[step], median(runs, count, step, 0),
           median(runs, count, step, 1), median(runs, count, step, 2), median(runs, count, step, 3));
  }
  return 0;
}
