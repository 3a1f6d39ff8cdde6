/* A process that loads and unloads the library again and again, as plug-ins do that link it:
 *   loading_host LIBRARY TIMES
 * Writes a line when it has loaded it for the first time: "loaded THREADS-BEFORE THREADS DESCRIPTORS-BEFORE
 * DESCRIPTORS"; one for each round that goes wrong; and "done THREADS MAPPED", with 1 for a library that is still
 * there. */
#include <dirent.h>
#include <dlfcn.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "client/VelkReportingC.h"

static int entriesIn(const char* path) {
  DIR* directory = opendir(path);
  int count = 0;
  while (directory != NULL && readdir(directory) != NULL) ++count;
  if (directory != NULL) closedir(directory);
  return count - 2;
}

static int isMapped(const char* name) {
  FILE* maps = fopen("/proc/self/maps", "r");
  char line[1024];
  int found = 0;
  while (maps != NULL && fgets(line, sizeof line, maps) != NULL) found = found || strstr(line, name) != NULL;
  if (maps != NULL) fclose(maps);
  return found;
}

/* A session with one event. */
static int report(void* library, int number) {
  VelkReportingValue* (*parse)(const char*, VelkReportingError**);
  void (*releaseValue)(VelkReportingValue*);
  VelkReportingClient* (*create)(const VelkReportingValue*, const VelkReportingValue*, const VelkReportingValue*);
  void (*start)(VelkReportingClient*, VelkReportingStatesCallback, void*, VelkReportingDestroyFunction);
  bool (*send)(VelkReportingClient*, uint16_t, uint16_t, const VelkReportingValue*, VelkReportingError**);
  void (*release)(VelkReportingClient*);
  *(void**)&parse = dlsym(library, "VelkReportingDictionaryCreateFromJSON");
  *(void**)&releaseValue = dlsym(library, "VelkReportingValueRelease");
  *(void**)&create = dlsym(library, "VelkReportingClientCreate");
  *(void**)&start = dlsym(library, "VelkReportingClientStartConfiguration");
  *(void**)&send = dlsym(library, "VelkReportingSendMessageWithError");
  *(void**)&release = dlsym(library, "VelkReportingClientRelease");
  if (!parse || !releaseValue || !create || !start || !send || !release) return 0;
  VelkReportingValue* session = parse("{\"ComponentType\": 9, \"ClientVersion\": 3, \"SessionID\": 1}", NULL);
  VelkReportingValue* user = parse("{\"_clientName\": \"Plugin\", \"_serviceName\": \"loading\"}", NULL);
  char text[64];
  snprintf(text, sizeof text, "{\"n\": %d}", number);
  VelkReportingValue* payload = parse(text, NULL);
  VelkReportingClient* client = create(session, user, NULL);
  start(client, NULL, NULL, NULL);
  const int sent = send(client, 7, 1, payload, NULL);
  release(client);
  releaseValue(payload);
  releaseValue(user);
  releaseValue(session);
  return client != NULL && sent;
}

int main(int argc, char** argv) {
  if (argc != 3) return 64;
  for (int round = 1; round <= atoi(argv[2]); ++round) {
    const int threadsBefore = entriesIn("/proc/self/task");
    const int descriptorsBefore = entriesIn("/proc/self/fd");
    void* library = dlopen(argv[1], RTLD_NOW | RTLD_LOCAL);
    if (library == NULL) {
      fprintf(stderr, "%s\n", dlerror());
      return 69;
    }
    if (round == 1) {
      printf("loaded %d %d %d %d\n", threadsBefore, entriesIn("/proc/self/task"), descriptorsBefore,
             entriesIn("/proc/self/fd"));
    }
    if (!report(library, round)) printf("wrong in round %d\n", round);
    if (dlclose(library) != 0) printf("not closed in round %d\n", round);
  }
  printf("done %d %d\n", entriesIn("/proc/self/task"), isMapped("libvelkreporting.so"));
  return 0;
}
