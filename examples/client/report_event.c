/* Reports one event and waits until the daemon has posted it: report_event [CLIENT-TYPE]
 *
 *   cc -std=c11 report_event.c $(pkg-config --cflags --libs velkreporting) */
#include <stdio.h>
#include <stdlib.h>
#include <threads.h>
#include <time.h>
#include <velkreporting/VelkReportingC.h>

/* What a callback on another thread tells this one. Both own it: whoever is last frees it. */
struct Answer {
  mtx_t lock;
  cnd_t changed;
  bool given;
  bool succeeded;
  int owners;
};

static struct Answer* new_answer(void) {
  struct Answer* answer = calloc(1, sizeof *answer);
  if (answer == NULL || mtx_init(&answer->lock, mtx_plain) != thrd_success ||
      cnd_init(&answer->changed) != thrd_success)
    abort();
  answer->owners = 2;
  return answer;
}

/* Fits as the destroy function of a callback: it is called once, after the last use. */
static void release_answer(void* context) {
  struct Answer* answer = context;
  mtx_lock(&answer->lock);
  const bool last = --answer->owners == 0;
  cnd_signal(&answer->changed);
  mtx_unlock(&answer->lock);
  if (!last) return;
  cnd_destroy(&answer->changed);
  mtx_destroy(&answer->lock);
  free(answer);
}

static void give(struct Answer* answer, bool succeeded) {
  mtx_lock(&answer->lock);
  answer->given = true;
  answer->succeeded = succeeded;
  cnd_signal(&answer->changed);
  mtx_unlock(&answer->lock);
}

static bool wait_for(struct Answer* answer) {
  struct timespec until;
  timespec_get(&until, TIME_UTC);
  until.tv_sec += 30;
  mtx_lock(&answer->lock);
  while (!answer->given && cnd_timedwait(&answer->changed, &answer->lock, &until) == thrd_success) continue;
  const bool succeeded = answer->given && answer->succeeded;
  mtx_unlock(&answer->lock);
  release_answer(answer);
  return succeeded;
}

static void configured(const VelkReportingValue* enabledBackends, void* context) {
  give(context, VelkReportingArrayGetCount(enabledBackends) != 0);
}

static void flushed(const VelkReportingError* error, void* context) {
  if (error != NULL) fprintf(stderr, "report_event: %s\n", VelkReportingErrorGetDescription(error));
  give(context, error == NULL);
}

int main(int argumentCount, char** arguments) {
  VelkReportingValue* session = VelkReportingDictionaryCreate();
  VelkReportingDictionarySetInteger(session, kVelkReportingSessionInfoClientType,
                                    argumentCount > 1 ? atoi(arguments[1]) : 9);
  VelkReportingDictionarySetInteger(session, kVelkReportingSessionInfoClientVersion, 1);
  VelkReportingDictionarySetInteger(session, kVelkReportingSessionInfoSessionID, 1);
  VelkReportingDictionarySetBoolean(session, kVelkReportingSessionInfoBatchEvent, true);
  VelkReportingValue* user = VelkReportingDictionaryCreate();
  VelkReportingDictionarySetString(user, kVelkReportingUserInfoClientName, "Example");
  VelkReportingDictionarySetString(user, kVelkReportingUserInfoServiceName, "report_event");

  VelkReportingClient* client = VelkReportingClientCreate(session, user, NULL);
  VelkReportingValueRelease(user);
  VelkReportingValueRelease(session);
  if (client == NULL) {
    fprintf(stderr, "report_event: the session info was refused\n");
    return EXIT_FAILURE;
  }
  struct Answer* states = new_answer();
  VelkReportingClientStartConfiguration(client, configured, states, release_answer);
  bool succeeded = wait_for(states);
  if (!succeeded) fprintf(stderr, "report_event: no backend is enabled; is velkreportingd running?\n");

  VelkReportingValue* payload = VelkReportingDictionaryCreateFromJSON("{\"answer\": 42, \"language\": \"C\"}", NULL);
  VelkReportingError* error = NULL;
  VelkReportingSendMessageWithError(client, 101, 1, payload, &error);
  VelkReportingValueRelease(payload);
  if (error != NULL) {
    fprintf(stderr, "report_event: %s\n", VelkReportingErrorGetDescription(error));
    VelkReportingErrorRelease(error);
    succeeded = false;
  }

  struct Answer* posted = new_answer();
  VelkReportingFlushMessagesWithCompletion(client, flushed, posted, release_answer);
  succeeded = wait_for(posted) && succeeded;
  VelkReportingClientRelease(client);
  return succeeded ? EXIT_SUCCESS : EXIT_FAILURE;
}
