/* Calls every function of the C interface, in C11, and gives everything back: run with a leak checker behind it.
 * every_function CLIENT-TYPE FILE. A daemon may be there or not; the answers that depend on it are printed. */
#include <stdatomic.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <threads.h>
#include <velkreporting/VelkReportingC.h>

#define REQUIRE(condition)                                                  \
  do {                                                                      \
    if (!(condition)) {                                                     \
      fprintf(stderr, "line %d does not hold: %s\n", __LINE__, #condition); \
      exit(EXIT_FAILURE);                                                   \
    }                                                                       \
  } while (0)

/* A context is allocated for each callback, and freed by its destroy function alone: the leak checker counts. */
static atomic_int contextsMade, contextsEnded;

static void* make_context(void) {
  contextsMade++;
  int* context = malloc(sizeof *context);
  REQUIRE(context != NULL);
  *context = 4711;
  return context;
}

static void end_context(void* context) {
  free(context);
  contextsEnded++;
}

static void use(void* context) { REQUIRE(*(int*)context == 4711); }

static void wait_a_moment(void) { thrd_sleep(&(struct timespec){.tv_nsec = 10000000}, NULL); }

static void wait_for_contexts(int number) {
  for (int turn = 0; turn < 6000 && contextsEnded < number; ++turn) wait_a_moment();
  REQUIRE(contextsEnded == number);
}

static VelkReportingValue* keptBackends;

static void heard_states(const VelkReportingValue* enabledBackends, void* context) {
  use(context);
  printf("backends: %zu\n", VelkReportingArrayGetCount(enabledBackends));
  keptBackends = VelkReportingValueRetain(enabledBackends);
}

static void heard_text(const char* text, void* context) {
  use(context);
  REQUIRE(text != NULL);
}

static VelkReportingError* keptError;
static atomic_bool flushIsHeard;

static void heard_flush(const VelkReportingError* error, void* context) {
  use(context);
  printf("flushed: %s\n", error == NULL ? "yes" : VelkReportingErrorGetDescription(error));
  keptError = VelkReportingErrorRetain(error);
  flushIsHeard = true;
}

static void heard_event(const VelkReportingValue* client, double timestamp, uint16_t category, uint16_t type,
                        const VelkReportingValue* payload, void* context) {
  (void)client, (void)timestamp, (void)category, (void)type, (void)payload;
  use(context);
}

static void heard_upload(bool uploaded, void* context) {
  (void)uploaded;
  use(context);
}

static void serve(VelkReportingValue* statistics, void* context) {
  use(context);
  VelkReportingDictionarySetInteger(statistics, "served", 1);
}

static void check_values(void) {
  VelkReportingValue* leaves[] = {
      VelkReportingValueCreateNull(),          VelkReportingValueCreateBoolean(true),
      VelkReportingValueCreateInteger(-1),     VelkReportingValueCreateUnsignedInteger(UINT64_MAX),
      VelkReportingValueCreateReal(0.5),       VelkReportingValueCreateDate(1.5),
      VelkReportingValueCreateString("text"),  VelkReportingValueCreateStringWithLength("text", 2),
      VelkReportingValueCreateData("bytes", 5)};
  VelkReportingValue* array = VelkReportingArrayCreate();
  for (size_t at = 0; at < sizeof leaves / sizeof *leaves; ++at) {
    REQUIRE(VelkReportingArrayAppend(array, leaves[at]));
    VelkReportingValue* copy = VelkReportingArrayCopyValue(array, at);
    REQUIRE(VelkReportingValueIsEqual(copy, leaves[at]));
    REQUIRE(VelkReportingValueGetType(copy) == VelkReportingValueGetType(leaves[at]));
    VelkReportingValueRelease(copy);
  }
  REQUIRE(VelkReportingArrayGetCount(array) == sizeof leaves / sizeof *leaves);
  REQUIRE(VelkReportingValueGetBoolean(leaves[1]));
  REQUIRE(VelkReportingValueGetInteger(leaves[2]) == -1);
  REQUIRE(VelkReportingValueGetUnsignedInteger(leaves[3]) == UINT64_MAX);
  REQUIRE(VelkReportingValueGetReal(leaves[4]) == 0.5);
  REQUIRE(VelkReportingValueGetDate(leaves[5]) == 1.5);
  size_t size = 0;
  REQUIRE(strcmp(VelkReportingValueGetString(leaves[7], &size), "te") == 0 && size == 2);
  REQUIRE(memcmp(VelkReportingValueGetData(leaves[8], &size), "bytes", 5) == 0 && size == 5);
  for (size_t at = 0; at < sizeof leaves / sizeof *leaves; ++at) VelkReportingValueRelease(leaves[at]);

  VelkReportingValue* dictionary = VelkReportingDictionaryCreate();
  REQUIRE(VelkReportingDictionarySet(dictionary, "array", array));
  REQUIRE(VelkReportingDictionarySetBoolean(dictionary, "boolean", true));
  REQUIRE(VelkReportingDictionarySetInteger(dictionary, "integer", 7));
  REQUIRE(VelkReportingDictionarySetReal(dictionary, "real", 1.25));
  REQUIRE(VelkReportingDictionarySetString(dictionary, "string", "word"));
  REQUIRE(VelkReportingDictionaryGetBoolean(dictionary, "boolean"));
  REQUIRE(VelkReportingDictionaryGetInteger(dictionary, "integer") == 7);
  REQUIRE(VelkReportingDictionaryGetReal(dictionary, "real") == 1.25);
  REQUIRE(strcmp(VelkReportingDictionaryGetString(dictionary, "string"), "word") == 0);
  REQUIRE(strcmp(VelkReportingDictionaryGetKey(dictionary, 0), "array") == 0);
  REQUIRE(VelkReportingDictionaryGetCount(dictionary) == 5);
  VelkReportingValue* within = VelkReportingDictionaryCopyValue(dictionary, "array");
  REQUIRE(VelkReportingValueIsEqual(within, array));
  VelkReportingValueRelease(within);
  VelkReportingValueRelease(array);
  char* text = VelkReportingValueCopyJSON(dictionary, NULL);
  VelkReportingValue* again = VelkReportingValueCreateFromJSON(text, NULL);
  VelkReportingValue* copy = VelkReportingValueCopy(again);
  REQUIRE(VelkReportingValueIsEqual(dictionary, copy));
  REQUIRE(VelkReportingDictionaryRemove(copy, "array"));
  VelkReportingValueRelease(copy);
  VelkReportingValueRelease(again);
  VelkReportingTextFree(text);
  REQUIRE(VelkReportingValueRetain(dictionary) == dictionary);
  VelkReportingValueRelease(dictionary);
  VelkReportingValueRelease(dictionary);
}

static void check_errors(void) {
  VelkReportingError* error = NULL;
  REQUIRE(VelkReportingDictionaryCreateFromJSON("[1", &error) == NULL);
  REQUIRE(VelkReportingErrorGetCode(error) == kVelkReportingErrorInvalidJSON);
  REQUIRE(strcmp(VelkReportingErrorGetDomain(error), kVelkReportingErrorDomain) == 0);
  VelkReportingValue* userInfo = VelkReportingErrorCopyUserInfo(error);
  REQUIRE(strcmp(VelkReportingDictionaryGetString(userInfo, "description"), VelkReportingErrorGetDescription(error)) ==
          0);
  VelkReportingValueRelease(userInfo);
  REQUIRE(VelkReportingErrorRetain(error) == error);
  VelkReportingErrorRelease(error);
  VelkReportingErrorRelease(error);
}

static void check_client(VelkReportingClient* client, const VelkReportingValue* user, const char* file) {
  VelkReportingClientStartConfiguration(client, heard_states, make_context(), end_context);
  wait_for_contexts(contextsMade - 1); /* that of the aggregation stays */
  VelkReportingValueRelease(keptBackends);
  VelkReportingFetchStatesWithUserInfo(client, user, heard_states, make_context(), end_context);
  wait_for_contexts(contextsMade - 1);
  VelkReportingValueRelease(keptBackends);
  VelkReportingSetMessageBlock(client, heard_text, make_context(), end_context);
  VelkReportingSetMessageBlock(client, heard_text, make_context(), end_context);

  VelkReportingError* error = NULL;
  REQUIRE(VelkReportingSendMessageWithError(client, 1, 1, user, &error) && error == NULL);
  REQUIRE(!VelkReportingSendMessageWithError(client, 0, 1, user, &error));
  REQUIRE(VelkReportingErrorGetCode(error) == kVelkReportingErrorInvalidCategory);
  VelkReportingErrorRelease(error);
  VelkReportingValue* message =
      VelkReportingDictionaryCreateFromJSON("{\"ParametersCategory\": 2, \"ParametersType\": 1}", NULL);
  REQUIRE(VelkReportingSendMessageWithDictionary(client, message, &error) && error == NULL);
  VelkReportingDictionaryRemove(message, kVelkReportingMessageParametersType);
  REQUIRE(!VelkReportingSendMessageWithDictionary(client, message, &error));
  REQUIRE(VelkReportingErrorGetCode(error) == kVelkReportingErrorMissingParameter);
  VelkReportingErrorRelease(error);
  VelkReportingValueRelease(message);

  VelkReportingUpdateSharedDataWithDictionary(client, user);
  VelkReportingUpdateSharedDataForKey(client, "key", user);
  VelkReportingUpdateSharedDataForKey(client, "key", NULL);
  REQUIRE(VelkReportingClientSetDigestKey(client, "key", 3, 0));
  VelkReportingClientSetEndOfLifeBound(client, 5000);
  VelkReportingClientSetEndOfLifeBound(NULL, 5000);
  VelkReportingValue* logData = VelkReportingValueCreateFromJSON("[{\"LogData\": \"line\"}]", NULL);
  REQUIRE(VelkReportingUploadLogWithArray(client, logData));
  VelkReportingValueRelease(logData);
  printf("uploads: %s\n", VelkReportingClientServerSupportsFileUpload(client) ? "yes" : "no");
  REQUIRE(VelkReportingClientUploadFile(client, file, heard_upload, make_context(), end_context));

  REQUIRE(VelkReportingClientRegisterPeriodicTask(client, 1, true, true, serve, make_context(), end_context));
  REQUIRE(VelkReportingClientRegisterPeriodicTask(client, 2, true, true, serve, make_context(), end_context));
  VelkReportingClientStartLogTimer(client, 1, 1, 3, 1);
  VelkReportingClientStopLogTimer(client);
  REQUIRE(VelkReportingClientUnregisterPeriodicTask(client, 1));
  REQUIRE(VelkReportingClientUnregisterPeriodicTask(client, 1)); /* true always */

  VelkReportingFlushMessagesWithCompletion(client, heard_flush, make_context(), end_context);
  for (int turn = 0; turn < 6000 && !flushIsHeard; ++turn) wait_a_moment();
  REQUIRE(flushIsHeard);
  VelkReportingErrorRelease(keptError);
  VelkReportingFlushMessages(client);
  VelkReportingClientFinishSession(client);
}

int main(int argumentCount, char** arguments) {
  REQUIRE(argumentCount == 3);
  check_values();
  check_errors();

  VelkReportingValue* session =
      VelkReportingDictionaryCreateFromJSON("{\"SessionID\": 1, \"BatchEvents\": true}", NULL);
  VelkReportingDictionarySetInteger(session, kVelkReportingSessionInfoClientType, atoi(arguments[1]));
  VelkReportingValue* root = VelkReportingNewHierarchyTokenFromParentToken(NULL);
  VelkReportingValue* token = VelkReportingCreateHierarchyTokenFromParentToken(root);
  VelkReportingDictionarySet(session, kVelkReportingSessionInfoHierarchyToken, token);
  VelkReportingValueRelease(token);
  VelkReportingValueRelease(root);
  VelkReportingValue* user = VelkReportingDictionaryCreateFromJSON("{\"_clientName\": \"Every\"}", NULL);
  VelkReportingValue* frameworks = VelkReportingArrayCreate();

  VelkReportingClient* client =
      VelkReportingClientCreateWithAggregation(session, user, frameworks, heard_event, make_context(), end_context);
  REQUIRE(client != NULL);
  check_client(client, user, arguments[2]);
  REQUIRE(VelkReportingClientRetain(client) == client);
  VelkReportingClientRelease(client);
  VelkReportingClientRelease(client);
  wait_for_contexts(contextsMade);

  client = VelkReportingClientCreate(session, user, NULL);
  VelkReportingClientRelease(client);
  REQUIRE(VelkReportingSendOneMessage(session, user, 4, 1, NULL, NULL));
  char* identifier = VelkReportingCopyPersistentIdentifier(true);
  VelkReportingRegeneratePersistentIdentifier(true);
  char* other = VelkReportingCopyPersistentIdentifier(true);
  REQUIRE(identifier != NULL && other != NULL && strcmp(identifier, other) != 0);
  VelkReportingTextFree(other);
  VelkReportingTextFree(identifier);
  VelkReportingValueRelease(frameworks);
  VelkReportingValueRelease(user);
  VelkReportingValueRelease(session);
  printf("contexts: %d made, %d ended\n", contextsMade, contextsEnded);
  return EXIT_SUCCESS;
}
