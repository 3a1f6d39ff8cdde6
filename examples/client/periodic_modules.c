/* Two modules report their statistics together, in one event: periodic_modules [CLIENT-TYPE [REPORTS]]
 *
 * Each second the library asks the modules to measure; every other second it asks for what they have instead, merges
 * it and sends it. Ends after as many reports as it was told, 1 if not. */
#include <stdatomic.h>
#include <stdio.h>
#include <stdlib.h>
#include <threads.h>
#include <time.h>
#include <velkreporting/VelkReportingC.h>

/* A module: what it has measured, updated and reported on threads of the library. */
struct Module {
  const char* name;
  atomic_int measurements;
  atomic_int reports;
};

static void serve(VelkReportingValue* statistics, void* context) {
  struct Module* module = context;
  if (statistics == NULL) {
    module->measurements++;
    return;
  }
  VelkReportingDictionarySetInteger(statistics, module->name, module->measurements);
  module->reports++;
}

int main(int argumentCount, char** arguments) {
  VelkReportingValue* session = VelkReportingDictionaryCreateFromJSON("{\"ClientVersion\": 1, \"SessionID\": 3}", NULL);
  VelkReportingDictionarySetInteger(session, kVelkReportingSessionInfoClientType,
                                    argumentCount > 1 ? atoi(arguments[1]) : 9);
  VelkReportingValue* user =
      VelkReportingDictionaryCreateFromJSON("{\"_clientName\": \"Example\", \"_serviceName\": \"modules\"}", NULL);
  VelkReportingClient* client = VelkReportingClientCreate(session, user, NULL);
  VelkReportingValueRelease(user);
  VelkReportingValueRelease(session);
  if (client == NULL) {
    fprintf(stderr, "periodic_modules: the session info was refused\n");
    return EXIT_FAILURE;
  }
  VelkReportingClientStartConfiguration(client, NULL, NULL, NULL);

  static struct Module reader = {.name = "reader"};
  static struct Module writer = {.name = "writer"};
  if (!VelkReportingClientRegisterPeriodicTask(client, 1, true, true, serve, &reader, NULL) ||
      !VelkReportingClientRegisterPeriodicTask(client, 2, true, true, serve, &writer, NULL)) {
    fprintf(stderr, "periodic_modules: a module was refused\n");
    VelkReportingClientRelease(client);
    return EXIT_FAILURE;
  }
  VelkReportingClientStartLogTimer(client, 1, 2, 102, 1);
  const int wanted = argumentCount > 2 ? atoi(arguments[2]) : 1;
  while (reader.reports < wanted || writer.reports < wanted) thrd_sleep(&(struct timespec){.tv_nsec = 20000000}, NULL);

  VelkReportingClientStopLogTimer(client);
  /* Waits until the tick is over; the last release ends the other module. */
  VelkReportingClientUnregisterPeriodicTask(client, 1);
  VelkReportingClientRelease(client);
  printf("reported %d times\n", (int)writer.reports);
  return EXIT_SUCCESS;
}
