/* A parent process sees the events of its child: shared_hierarchy [CLIENT-TYPE]
 *
 * The parent makes a token, opens a session with it and starts a child; the child makes a token below the parent's,
 * opens a session of its own and reports an event. The daemon links the two: the parent is handed the child's event,
 * whether or not a backend takes it. */
#define _POSIX_C_SOURCE 200809L
#include <semaphore.h>
#include <spawn.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <time.h>
#include <velkreporting/VelkReportingC.h>

extern char** environ;

static sem_t configured, aggregated;
static bool isConfigured; /* written before `configured` is posted */

static void complain(const char* text) { fprintf(stderr, "shared_hierarchy: %s\n", text); }

static bool wait_for(sem_t* semaphore) {
  struct timespec until;
  clock_gettime(CLOCK_REALTIME, &until);
  until.tv_sec += 30;
  return sem_timedwait(semaphore, &until) == 0;
}

static void heard_states(const VelkReportingValue* enabledBackends, void* context) {
  isConfigured = enabledBackends != NULL;
  sem_post(context);
}

static void heard_event(const VelkReportingValue* from, double timestamp, uint16_t category, uint16_t type,
                        const VelkReportingValue* payload, void* context) {
  (void)timestamp;
  if (VelkReportingDictionaryGetString(payload, "from") == NULL) return; /* the daemon's own, and the last call */
  printf("event %u/%u of session %lld: from %s\n", category, type,
         (long long)VelkReportingDictionaryGetInteger(from, kVelkReportingSessionInfoSessionID),
         VelkReportingDictionaryGetString(payload, "from"));
  fflush(stdout);
  sem_post(context);
}

/* A session that the daemon has configured, or NULL. */
static VelkReportingClient* open_session(const char* type, int number, const VelkReportingValue* token,
                                         VelkReportingAggregationCallback callback) {
  VelkReportingValue* session = VelkReportingDictionaryCreate();
  VelkReportingDictionarySetInteger(session, kVelkReportingSessionInfoClientType, atoi(type));
  VelkReportingDictionarySetInteger(session, kVelkReportingSessionInfoSessionID, number);
  VelkReportingDictionarySet(session, kVelkReportingSessionInfoHierarchyToken, token);
  VelkReportingValue* user = VelkReportingDictionaryCreateFromJSON("{\"_clientName\": \"Example\"}", NULL);
  VelkReportingClient* client =
      VelkReportingClientCreateWithAggregation(session, user, NULL, callback, &aggregated, NULL);
  VelkReportingValueRelease(user);
  VelkReportingValueRelease(session);
  if (client == NULL) {
    complain("the session info was refused");
    return NULL;
  }
  VelkReportingClientStartConfiguration(client, heard_states, &configured, NULL);
  if (wait_for(&configured) && isConfigured) return client;
  complain("the session is not configured; is velkreportingd running?");
  VelkReportingClientRelease(client);
  return NULL;
}

static int failed(VelkReportingError* error) {
  complain(error != NULL ? VelkReportingErrorGetDescription(error) : "memory is short");
  VelkReportingErrorRelease(error);
  return EXIT_FAILURE;
}

/* The child: its token stands one level below the one that it was given. */
static int run_child(const char* type, const char* parentToken) {
  VelkReportingError* error = NULL;
  VelkReportingValue* parent = VelkReportingDictionaryCreateFromJSON(parentToken, &error);
  if (parent == NULL) return failed(error); /* a token of no parent would be a new root */
  VelkReportingValue* token = VelkReportingNewHierarchyTokenFromParentToken(parent);
  VelkReportingValueRelease(parent);
  VelkReportingClient* client = open_session(type, 6, token, NULL);
  VelkReportingValueRelease(token);
  if (client == NULL) return EXIT_FAILURE;
  VelkReportingValue* payload = VelkReportingDictionaryCreate();
  VelkReportingDictionarySetString(payload, "from", "the child");
  const bool sent = VelkReportingSendMessageWithError(client, 104, 1, payload, &error);
  VelkReportingValueRelease(payload);
  VelkReportingClientRelease(client); /* sends what is queued */
  return sent && error == NULL ? EXIT_SUCCESS : failed(error);
}

/* A new program: a process that was merely forked cannot report through what its parent made. */
static bool spawn_child(const char* program, const char* type, char* tokenText) {
  pid_t child = 0;
  int status = 0;
  char* const arguments[] = {(char*)program, (char*)type, tokenText, NULL};
  if (tokenText == NULL || posix_spawn(&child, program, NULL, NULL, arguments, environ) != 0 ||
      waitpid(child, &status, 0) != child || status != 0) {
    complain("the child failed");
    return false;
  }
  if (wait_for(&aggregated)) return true;
  complain("the child's event did not come");
  return false;
}

static int run_parent(const char* program, const char* type) {
  VelkReportingValue* token = VelkReportingNewHierarchyTokenFromParentToken(NULL);
  char* tokenText = VelkReportingValueCopyJSON(token, NULL);
  VelkReportingClient* client = open_session(type, 5, token, heard_event);
  VelkReportingValueRelease(token);
  const bool succeeded = client != NULL && spawn_child(program, type, tokenText);
  VelkReportingTextFree(tokenText);
  VelkReportingClientRelease(client);
  return succeeded ? EXIT_SUCCESS : EXIT_FAILURE;
}

int main(int argumentCount, char** arguments) {
  sem_init(&configured, 0, 0);
  sem_init(&aggregated, 0, 0);
  const char* type = argumentCount > 1 ? arguments[1] : "9";
  return argumentCount > 2 ? run_child(type, arguments[2]) : run_parent("/proc/self/exe", type);
}
