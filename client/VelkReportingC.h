/* The C interface of the reporting library. Compiles as C11 and as C++; link with libvelkreporting.
 *
 *   VelkReportingValue *session = VelkReportingDictionaryCreateFromJSON(
 *       "{\"ComponentType\": 9, \"ClientVersion\": 3, \"SessionID\": 1, \"BatchEvents\": true}", NULL);
 *   VelkReportingValue *user = VelkReportingDictionaryCreateFromJSON("{\"_clientName\": \"Sampler\"}", NULL);
 *   VelkReportingClient *client = VelkReportingClientCreate(session, user, NULL);
 *   VelkReportingClientStartConfiguration(client, NULL, NULL, NULL);
 *   VelkReportingSendMessageWithError(client, 2, 1, payload, NULL);
 *   VelkReportingClientRelease(client);
 *
 * Handles. Functions with Create, Copy or New in their name answer a handle that the caller owns and releases, once;
 * Retain adds an owner, Release takes one away. Handles given to a function stay the caller's, and what they hold is
 * copied. Null pointers are allowed everywhere. A null client: nothing at all happens, but for the end of a callback's
 * context, and the answer is false or null. Another null handle, or a value of a type that the function has no use for,
 * counts as none; the functions that read or change it answer false, 0 or null.
 *
 * Errors. An out-parameter `error` may be null. Otherwise it is always set, to null or to an error that the caller owns
 * and releases: look at it even when the answer is true (VelkReportingSendMessageWithError says why). With a null
 * client alone it stays as it was: give it a value first. When memory is short, functions answer false or null without
 * an error, with a line in the log.
 *
 * The log. Errors go to the system's log, at most 60 of them a minute; one that the log daemon does not take at once
 * is lost. When the environment says VELKREPORTING_LOG=default, they are written to the standard error stream instead,
 * all of them, and with them the lines of the default level, which tell why a client was not created, a file not taken,
 * or what was lost because no daemon answered.
 *
 * Callbacks. A callback comes with a `context`, handed back to it as it is, and a `destroy` function for that context;
 * callback, context and destroy may each be null. Callbacks run on threads of the library that are there only while
 * they are needed, never on the calling thread; answers never come before the daemon gave them or proved to be away.
 * They may block, and may call any function here. What they are given is borrowed: it is gone when they return, unless
 * they retain it. `destroy` is called exactly once, after the last use of the context, also when the callback is never
 * called: on a thread of the library or, when there is nothing to wait for, on the calling thread. A callback must not
 * throw; only an aggregation callback may, and is then never called again.
 *
 * Threads. Any thread may call any function on clients and errors. A value is used by one thread at a time while one
 * of them changes it. No function waits for the daemon but the last VelkReportingClientRelease, within a bound; and
 * none for a callback but VelkReportingClientUnregisterPeriodicTask and, within its bound, the last release: do not
 * hold a lock that a module's callback wants. In a child made by fork(), clients of the parent do nothing: contexts
 * that are handed over end at once, events are answered with error 9. Values, errors and clients that it makes itself
 * work as anywhere. */
#pragma once

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#include "client/VelkReportingKeys.h"
#include "foundation/Export.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct VelkReportingClient VelkReportingClient;
typedef struct VelkReportingError VelkReportingError;
/* A property value: a dictionary, an array, or what they hold. */
typedef struct VelkReportingValue VelkReportingValue;

/* Ends a callback's context; see above. */
typedef void (*VelkReportingDestroyFunction)(void* context);

/* ---- Errors ---- */

/* Codes in kVelkReportingErrorDomain. The errors of a flush have others: see VelkReportingFlushCallback. */
enum {
  kVelkReportingErrorNoSessionInfo = 2,
  kVelkReportingErrorInvalidClientType = 3, /* outside 5 to 30 */
  kVelkReportingErrorInvalidCategory = 4,   /* 0, after cutting to 16 bits */
  kVelkReportingErrorMissingParameter = 7,  /* no "ParametersCategory" or no "ParametersType" */
  kVelkReportingErrorOutboxFull = 8,        /* the daemon is away or slow, and the event was not taken */
  kVelkReportingErrorForkedChild = 9,       /* the client belongs to the parent of this process */
  kVelkReportingErrorWrongType = 10,        /* an argument is no dictionary where one is needed */
  kVelkReportingErrorInvalidJSON = 11,      /* text that is no JSON, or a value that has no form in it */
  /* An event that no daemon would take: more than 1 MiB on its way (the readable JSON is longer, as a rule), 65,536
   * values, or 4,096 keys in one dictionary; dictionaries and arrays more than 31 within each other, the message being
   * the first and its payload the second (in VelkReportingSendOneMessage the payload is the first). A line in the log
   * says so as well. */
  kVelkReportingErrorNotSendable = 12,
  kVelkReportingErrorNoResources = 13 /* the system gave the library no thread or no descriptors */
};

/* Adds an owner; answers `error`. Retaining a borrowed error makes the caller an owner. */
VELK_EXPORT VelkReportingError* VelkReportingErrorRetain(const VelkReportingError* error);
VELK_EXPORT void VelkReportingErrorRelease(VelkReportingError* error);
/* Texts are the error's and last as long as it does. The description is empty where there is none. */
VELK_EXPORT const char* VelkReportingErrorGetDomain(const VelkReportingError* error);
VELK_EXPORT int32_t VelkReportingErrorGetCode(const VelkReportingError* error);
VELK_EXPORT const char* VelkReportingErrorGetDescription(const VelkReportingError* error);
/* A new dictionary: the description under "description", or nothing. */
VELK_EXPORT VelkReportingValue* VelkReportingErrorCopyUserInfo(const VelkReportingError* error);

/* ---- Values ---- */

typedef enum {
  kVelkReportingValueTypeNull = 0,
  kVelkReportingValueTypeBoolean = 1,
  kVelkReportingValueTypeInteger = 2,
  kVelkReportingValueTypeUnsignedInteger = 3, /* only what does not fit into a signed one */
  kVelkReportingValueTypeReal = 4,
  kVelkReportingValueTypeDate = 5,
  kVelkReportingValueTypeString = 6,
  kVelkReportingValueTypeData = 7,
  kVelkReportingValueTypeArray = 8,
  kVelkReportingValueTypeDictionary = 9
} VelkReportingValueType;

/* New values; the caller owns them. Text must be UTF-8. Null for a null or malformed text, for null data of a size
 * above 0, and when memory is short. Contents are copied. An unsigned integer that fits into a signed one becomes one:
 * equal numbers are equal values. Reals and dates may be infinite or no number. */
VELK_EXPORT VelkReportingValue* VelkReportingValueCreateNull(void);
VELK_EXPORT VelkReportingValue* VelkReportingValueCreateBoolean(bool value);
VELK_EXPORT VelkReportingValue* VelkReportingValueCreateInteger(int64_t value);
VELK_EXPORT VelkReportingValue* VelkReportingValueCreateUnsignedInteger(uint64_t value);
VELK_EXPORT VelkReportingValue* VelkReportingValueCreateReal(double value);
VELK_EXPORT VelkReportingValue* VelkReportingValueCreateDate(double secondsSince1970);
VELK_EXPORT VelkReportingValue* VelkReportingValueCreateString(const char* text);
VELK_EXPORT VelkReportingValue* VelkReportingValueCreateStringWithLength(const char* text, size_t length);
VELK_EXPORT VelkReportingValue* VelkReportingValueCreateData(const void* bytes, size_t size);
VELK_EXPORT VelkReportingValue* VelkReportingArrayCreate(void);
VELK_EXPORT VelkReportingValue* VelkReportingDictionaryCreate(void);

/* From JSON (RFC 8259); dates and data stand in it as {"$date": seconds} and {"$data": "base64"}. Of a key given twice
 * the last value counts. Numbers without a fraction or exponent are integers if they fit into 64 bits, all others
 * reals. Null, with error code 11 that names the place, for null, for text that is no JSON or no UTF-8, for a number
 * too large for a real, for objects and arrays more than 64 within each other, for more than 1,048,576 values, or
 * (Dictionary) for what is no object at the top. */
VELK_EXPORT VelkReportingValue* VelkReportingValueCreateFromJSON(const char* text, VelkReportingError** error);
VELK_EXPORT VelkReportingValue* VelkReportingDictionaryCreateFromJSON(const char* text, VelkReportingError** error);
/* The same form, compact; the caller frees the text with VelkReportingTextFree (or free). Null, with error code 11,
 * for a null value and for a number that is not finite. */
VELK_EXPORT char* VelkReportingValueCopyJSON(const VelkReportingValue* value, VelkReportingError** error);
VELK_EXPORT void VelkReportingTextFree(char* text);

/* Adds an owner; answers `value`. Retaining a borrowed value makes the caller an owner. */
VELK_EXPORT VelkReportingValue* VelkReportingValueRetain(const VelkReportingValue* value);
VELK_EXPORT void VelkReportingValueRelease(VelkReportingValue* value);
/* A value of its own with equal contents: changes of the one are not seen in the other. */
VELK_EXPORT VelkReportingValue* VelkReportingValueCopy(const VelkReportingValue* value);
/* Two null handles are equal. Dictionaries are equal when they hold equal values under the same keys. */
VELK_EXPORT bool VelkReportingValueIsEqual(const VelkReportingValue* left, const VelkReportingValue* right);

/* Null handles are of type null. */
VELK_EXPORT VelkReportingValueType VelkReportingValueGetType(const VelkReportingValue* value);
/* Lenient: numbers are converted (towards zero, to the nearest bound: an unsigned integer beyond 2^63-1 reads as that;
 * what is no number is 0), text is read as a number from its beginning; as a boolean it is true when it begins, after
 * blanks, a sign and zeros, with Y, y, T, t or a digit from 1 to 9. Everything else is false or 0. */
VELK_EXPORT bool VelkReportingValueGetBoolean(const VelkReportingValue* value);
VELK_EXPORT int64_t VelkReportingValueGetInteger(const VelkReportingValue* value);
VELK_EXPORT double VelkReportingValueGetReal(const VelkReportingValue* value);
/* Strict: 0 for a value of another type or, for the first, below 0. */
VELK_EXPORT uint64_t VelkReportingValueGetUnsignedInteger(const VelkReportingValue* value);
VELK_EXPORT double VelkReportingValueGetDate(const VelkReportingValue* value);
/* Strict: null for a value of another type. The text (with a zero behind it) and the bytes are the value's: they last
 * until it is changed or released. `length` and `size`, when not null, are set, to 0 with a null answer. */
VELK_EXPORT const char* VelkReportingValueGetString(const VelkReportingValue* value, size_t* length);
VELK_EXPORT const void* VelkReportingValueGetData(const VelkReportingValue* value, size_t* size);

/* Arrays. A value is copied into the array, also when it is the array itself. False, and nothing changes, when `array`
 * is no array, `value` is null, the result would nest deeper than 64 or hold more than 1,048,576 values, all levels
 * together, or memory is short. (What goes to the daemon has narrower bounds: see kVelkReportingErrorNotSendable.) */
VELK_EXPORT bool VelkReportingArrayAppend(VelkReportingValue* array, const VelkReportingValue* value);
VELK_EXPORT size_t VelkReportingArrayGetCount(const VelkReportingValue* array);
/* The caller owns the answer; changes of it are not seen in the array. Null beyond the end. */
VELK_EXPORT VelkReportingValue* VelkReportingArrayCopyValue(const VelkReportingValue* array, size_t index);

/* Dictionaries keep the order of insertion. A value is copied into the dictionary and replaces what was under the key.
 * False, and nothing changes, when `dictionary` is no dictionary, the key or value is null, key or text is not UTF-8,
 * the result would nest deeper than 64 or hold more than 1,048,576 values, or memory is short. */
VELK_EXPORT bool VelkReportingDictionarySet(VelkReportingValue* dictionary, const char* key,
                                            const VelkReportingValue* value);
VELK_EXPORT bool VelkReportingDictionarySetBoolean(VelkReportingValue* dictionary, const char* key, bool value);
VELK_EXPORT bool VelkReportingDictionarySetInteger(VelkReportingValue* dictionary, const char* key, int64_t value);
VELK_EXPORT bool VelkReportingDictionarySetReal(VelkReportingValue* dictionary, const char* key, double value);
VELK_EXPORT bool VelkReportingDictionarySetString(VelkReportingValue* dictionary, const char* key, const char* text);
/* False when there was nothing under the key. */
VELK_EXPORT bool VelkReportingDictionaryRemove(VelkReportingValue* dictionary, const char* key);
VELK_EXPORT size_t VelkReportingDictionaryGetCount(const VelkReportingValue* dictionary);
/* Null beyond the end. The text is the dictionary's and lasts until that is changed or released. (A key that came with
 * a zero in it, from JSON or from another process, ends at it here, and cannot be named.) */
VELK_EXPORT const char* VelkReportingDictionaryGetKey(const VelkReportingValue* dictionary, size_t index);
/* The caller owns the answer; changes of it are not seen in the dictionary. Null when there is nothing. */
VELK_EXPORT VelkReportingValue* VelkReportingDictionaryCopyValue(const VelkReportingValue* dictionary, const char* key);
/* As VelkReportingValueGetBoolean, ...GetInteger, ...GetReal and ...GetString of the value under the key; null, false
 * or 0 when there is none. The text lasts until the dictionary is changed or released. */
VELK_EXPORT bool VelkReportingDictionaryGetBoolean(const VelkReportingValue* dictionary, const char* key);
VELK_EXPORT int64_t VelkReportingDictionaryGetInteger(const VelkReportingValue* dictionary, const char* key);
VELK_EXPORT double VelkReportingDictionaryGetReal(const VelkReportingValue* dictionary, const char* key);
VELK_EXPORT const char* VelkReportingDictionaryGetString(const VelkReportingValue* dictionary, const char* key);

/* ---- Creating a client ---- */

/* The names of the backends that are enabled (an array of text), or null when the session is not configured: the daemon
 * could not be asked, or has no storebag for it. */
typedef void (*VelkReportingStatesCallback)(const VelkReportingValue* enabledBackends, void* context);
/* An event of this client or of a session below it: session info of its client (null, with everything else null or 0,
 * in the call that ends the aggregation), time in seconds since 1970, category, type, payload with the sender's user
 * info merged in. Called in order, one at a time. While the callback is slow, 16,384 events (or 8 MiB of them)
 * wait; more are dropped, which the log hears of. */
typedef void (*VelkReportingAggregationCallback)(const VelkReportingValue* client, double timestamp, uint16_t category,
                                                 uint16_t type, const VelkReportingValue* payload, void* context);

/* A client for this session info and user info (dictionaries; user info may be null) and the names of frameworks that
 * are handed to the daemon (an array of text, or null; what is no text in it is left out). The caller owns it. The
 * daemon need not be running. Null, with a line of the default level in the log, without session info, with a client
 * type outside 5 to 30, or with an "EnableFlag" of 0; and, with an error line, when the system gives the library no
 * thread or no descriptors. A session info or user info beyond the bounds of an event (see
 * kVelkReportingErrorNotSendable) never reaches the daemon: a line in the log says so, and nothing will be reported. */
VELK_EXPORT VelkReportingClient* VelkReportingClientCreate(const VelkReportingValue* sessionInfo,
                                                           const VelkReportingValue* userInfo,
                                                           const VelkReportingValue* frameworksToCheck);
/* The same, with a callback that is handed the client's events and those of the sessions below it in its hierarchy.
 * Without a callback it is VelkReportingClientCreate. The context ends with the client. */
VELK_EXPORT VelkReportingClient* VelkReportingClientCreateWithAggregation(const VelkReportingValue* sessionInfo,
                                                                          const VelkReportingValue* userInfo,
                                                                          const VelkReportingValue* frameworksToCheck,
                                                                          VelkReportingAggregationCallback callback,
                                                                          void* context,
                                                                          VelkReportingDestroyFunction destroy);
/* Has the daemon build the session's backends: once, before events are sent. The callback hears which are enabled, or
 * that the daemon could not be asked; then the session is configured once it is there. */
VELK_EXPORT void VelkReportingClientStartConfiguration(VelkReportingClient* client,
                                                       VelkReportingStatesCallback callback, void* context,
                                                       VelkReportingDestroyFunction destroy);
/* Adds an owner; answers `client`. */
VELK_EXPORT VelkReportingClient* VelkReportingClientRetain(VelkReportingClient* client);
/* The last owner's release sends what is queued (for at most a second, unless a bound is set), finishes the session and
 * closes the connection. Answers that have not come by then are not waited for: completions of configurations and
 * flushes hear that they failed, those of uploads nothing; all contexts end. It may be called from a callback of the
 * client itself. */
VELK_EXPORT void VelkReportingClientRelease(VelkReportingClient* client);
/* How long the last release may wait for what is queued to leave, and how long the end of the process may (by exit(),
 * or a return from main) while the client has an owner: 1,000 unless set, at most an hour. What has not left by then is
 * lost. */
VELK_EXPORT void VelkReportingClientSetEndOfLifeBound(VelkReportingClient* client, uint32_t milliseconds);

/* ---- Reporting ---- */

/* Gives the session a new user info (a dictionary) and asks which backends are enabled now. Null leaves the one that it
 * has or, in a session that requires none ("RequireUserDict" false), takes it away. */
VELK_EXPORT void VelkReportingFetchStatesWithUserInfo(VelkReportingClient* client, const VelkReportingValue* userInfo,
                                                      VelkReportingStatesCallback callback, void* context,
                                                      VelkReportingDestroyFunction destroy);

/* The text of each message that left, and the address at which reports can be viewed; in order, one at a time. While
 * the callback is slow, 16,384 texts (or 8 MiB of them) wait; more are dropped, which the log hears of. */
typedef void (*VelkReportingMessageCallback)(const char* text, void* context);
/* Replaces the callback of before, whose context is then destroyed; a null callback ends it. The context ends with the
 * client at the latest. */
VELK_EXPORT void VelkReportingSetMessageBlock(VelkReportingClient* client, VelkReportingMessageCallback callback,
                                              void* context, VelkReportingDestroyFunction destroy);

/* Sends an event; `payload` is a dictionary or null. Never blocks. False for category 0 (code 4), and for a payload
 * that is no dictionary (10). True otherwise, even when the storebag filters the event, then without an error, and when
 * it was not taken: then with an error (8, 9 or 12), which the caller releases like any other. */
VELK_EXPORT bool VelkReportingSendMessageWithError(VelkReportingClient* client, uint16_t category, uint16_t type,
                                                   const VelkReportingValue* payload, VelkReportingError** error);
/* Sends an event given as a message dictionary. Never blocks. False without an error when the storebag filters it;
 * false with one for a missing category or type (code 7, without a text), category 0 (4), when it was not taken (8, 9,
 * 12), and for a message that is null or no dictionary (10). */
VELK_EXPORT bool VelkReportingSendMessageWithDictionary(VelkReportingClient* client, const VelkReportingValue* message,
                                                        VelkReportingError** error);

/* Has the daemon post what it batched for this session. */
VELK_EXPORT void VelkReportingFlushMessages(VelkReportingClient* client);
/* Why it failed, or null, in the words, domain and code of who found out: the session (kVelkReportingErrorDomain: -1,
 * or the status of a server that refused), its transport, or the connection, "VelkConnectionErrorDomain": 9 no daemon
 * answers, 1 it went away before it had answered, 2 it reads too slowly, 10 this process may not use its socket. */
typedef void (*VelkReportingFlushCallback)(const VelkReportingError* error, void* context);
VELK_EXPORT void VelkReportingFlushMessagesWithCompletion(VelkReportingClient* client,
                                                          VelkReportingFlushCallback callback, void* context,
                                                          VelkReportingDestroyFunction destroy);
/* Marks the session as finished gracefully. Overtakes what is still queued, and awaits nothing. Lost, with a line in
 * the log, when no daemon answers. */
VELK_EXPORT void VelkReportingClientFinishSession(VelkReportingClient* client);

/* Data that the sessions of one hierarchy share: it travels with the events of all of them. Nothing happens without a
 * dictionary or key, and for a key that is no UTF-8. Lost, with a line in the log, when no daemon answers. */
VELK_EXPORT void VelkReportingUpdateSharedDataWithDictionary(VelkReportingClient* client,
                                                             const VelkReportingValue* dictionary);
/* A null value removes the key. */
VELK_EXPORT void VelkReportingUpdateSharedDataForKey(VelkReportingClient* client, const char* key,
                                                     const VelkReportingValue* value);

/* Uploads log data, an array of dictionaries. True: handed over; lost, with a line in the log, when no daemon answers.
 * False for an empty array, for no array, and (with a line in the log) when something else stands in it. */
VELK_EXPORT bool VelkReportingUploadLogWithArray(VelkReportingClient* client, const VelkReportingValue* logData);
typedef void (*VelkReportingUploadCallback)(bool uploaded, void* context);
/* Uploads a file: a path, or a file address ("file:/PATH" or "file://HOST/PATH": percent escapes are resolved, the host
 * does not count). It is opened before this returns, with the caller's rights, from the process's current directory if
 * the path is relative, and without following a link at its end. When the server says that it has the file, it is
 * removed, unless another one has taken its name.
 *
 * True: handed over, and the callback hears whether an upload was attempted, unless the daemon is away or goes before
 * it answers: then the context ends, and nothing is said. A directory, FIFO, socket or link is handed over too, and the
 * answer is false. False, with a line of the default level that names the path and the system's error number, when
 * nothing is there (2), it may not be read (13), the path is too long (36) or no UTF-8 (84; as an address, with its
 * bytes escaped, it is taken), and while 64 files of this client wait for their answers (24).
 *
 * Keep the client until the callback came. The last release closes the session: an upload that has not been answered by
 * then may go on, but nobody waits for the answer: the callback may never be called, and the file stay, even when it
 * was delivered. */
VELK_EXPORT bool VelkReportingClientUploadFile(VelkReportingClient* client, const char* path,
                                               VelkReportingUploadCallback callback, void* context,
                                               VelkReportingDestroyFunction destroy);
/* Whether the daemon said that files may be uploaded. */
VELK_EXPORT bool VelkReportingClientServerSupportsFileUpload(VelkReportingClient* client);
/* The key of the digest that goes with each post of the "qrs" backend: an HMAC of its JSON with SHA-1, by algorithm
 * 0; by any other there is none. Call it after VelkReportingClientStartConfiguration: a key that comes before
 * reaches the backend with the next user info only. A later user info makes the algorithm 0. False without a key. */
VELK_EXPORT bool VelkReportingClientSetDigestKey(VelkReportingClient* client, const void* key, size_t size,
                                                 uint32_t algorithm);

/* ---- Periodic tasks ---- */

/* While the log timer runs, each tick asks the modules that want it to update their measurements (`statistics` is
 * null); each tick of number `reportingMultiplier` asks the reporting modules to fill in theirs instead: `statistics`
 * is then an empty dictionary, what all modules put in is merged and sent as one realtime event. Callbacks run in
 * parallel, at most four at once. Calls that are made during a tick reach the daemon after it, so a slow module delays
 * them. */
typedef void (*VelkReportingServiceCallback)(VelkReportingValue* statistics, void* context);
/* Registers a module, in place of an earlier registration under its number. False without a callback, and (with a line
 * in the log) beyond 4,096 modules. The context ends when the module is replaced or unregistered, or with the client,
 * after the last call that has begun. */
VELK_EXPORT bool VelkReportingClientRegisterPeriodicTask(VelkReportingClient* client, uint32_t module,
                                                         bool needToUpdate, bool needToReport,
                                                         VelkReportingServiceCallback callback, void* context,
                                                         VelkReportingDestroyFunction destroy);
/* True for every client, also for a module that is not registered. Waits until the tick that has begun is over: the
 * module's callback does not run after this returned, and its context is destroyed by then or a moment later. So
 * callbacks must not wait for a thread that is in here, nor for a lock that it holds. Called from a callback of one of
 * this client's modules it does not wait: the module is not called any more, but a call that has begun goes on. */
VELK_EXPORT bool VelkReportingClientUnregisterPeriodicTask(VelkReportingClient* client, uint32_t module);
/* Ticks at once, and then every `interval` seconds; missed ticks are made up for by one. With a multiplier of 0 there
 * are only updates. Nothing happens when the timer runs already, nor (but for a line in the log) for an interval of 0.
 * It stops with the client. */
VELK_EXPORT void VelkReportingClientStartLogTimer(VelkReportingClient* client, uint32_t interval,
                                                  uint32_t reportingMultiplier, uint16_t category, uint16_t type);
/* No tick begins for calls made from here on; one that has begun is not waited for. */
VELK_EXPORT void VelkReportingClientStopLogTimer(VelkReportingClient* client);

/* ---- Without a client ---- */

/* A token for a session below that of `parentToken` (null: a new root of level 0), for the session info. The caller
 * owns it. Null when the parent is no dictionary or has no "token". The two names are synonyms. */
VELK_EXPORT VelkReportingValue* VelkReportingNewHierarchyTokenFromParentToken(const VelkReportingValue* parentToken);
VELK_EXPORT VelkReportingValue* VelkReportingCreateHierarchyTokenFromParentToken(const VelkReportingValue* parentToken);

/* Reports a single event. True: it was taken; delivery is not reported, and without a daemon it is lost. The end of the
 * process, by exit() or a return from main, waits for those under way, for at most a second. False, with an error: 2,
 * 3, 4, 10 for a payload or user info that is no dictionary, 12, 13, or 8 when 256 of them are waiting. */
VELK_EXPORT bool VelkReportingSendOneMessage(const VelkReportingValue* sessionInfo, const VelkReportingValue* userInfo,
                                             uint16_t category, uint16_t type, const VelkReportingValue* payload,
                                             VelkReportingError** error);

/* A random identifier of this user that lasts until it is regenerated: one for use while the user's consent to
 * diagnostics and usage data is respected, one for use regardless of it. Made at first use, and kept where no daemon
 * reads it; without a home directory each call makes a new one. The caller frees the text with VelkReportingTextFree.
 */
VELK_EXPORT char* VelkReportingCopyPersistentIdentifier(bool respectConsent);
VELK_EXPORT void VelkReportingRegeneratePersistentIdentifier(bool respectConsent);

#ifdef __cplusplus
}
#endif
