/*
 * The C interface of a diagnostics adaptor: a shared object that takes the events of the "quill" backend and hands
 * them to the diagnostics service of its device. Compiles as C11 and as C++; nothing else of the system is needed.
 *
 * The administrator names the adaptor in adaptors.conf of the daemon's configuration directory:
 *
 *     QuillAdaptor=/usr/lib/velkreporting/quill.so
 *
 * The daemon loads it when the first session needs it, calls VelkReportingCreateQuillAdaptor once for each session's
 * backend, hands every event of that backend to the instance, and releases the instance some time after the session's
 * end. The shared object is never unloaded. While it is loaded its constructors run; they must not wait for anything.
 *
 * Trust: an adaptor is part of the daemon's process. What it does wrong with memory ends the daemon. The daemon
 * therefore loads no file that anybody but root or the daemon's own user could have written: the file and every
 * directory on the way to it must belong to one of these and be writable by nobody else.
 *
 * Threads: calls of one instance never overlap. Calls of different instances do, on different threads, none of which
 * is the same for long: keep nothing in thread-local storage. A call is made on the thread that serves the client,
 * with no lock of the daemon held. While it lasts, that client's later events wait and nobody else's do; it should
 * return within milliseconds. When 16 calls of an adaptor are under way at once, the daemon drops events that would
 * make it 17, with a line in its log. When one does not return, the daemon's own end does not wait for it for ever.
 *
 * Errors: a result other than 0 is a failure. The daemon logs it and goes on; an event is never handed over again. No
 * C++ exception should leave an adaptor; one that does counts as a failure of the call.
 */
#ifndef VELK_REPORTING_QUILL_ADAPTOR_H
#define VELK_REPORTING_QUILL_ADAPTOR_H

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* The version of this interface. */
#define VELK_REPORTING_QUILL_ADAPTOR_VERSION 1

/* One instance, filled in by VelkReportingCreateQuillAdaptor. The functions must stay valid as long as the process. */
typedef struct VelkReportingQuillAdaptor {
  /* The adaptor's own: handed to its functions as it is. */
  void *context;

  /*
   * Takes one event. `method` and `respCode` are the category and type that the client gave it. `dict` is the event as
   * a JSON object in UTF-8 on one line, `length` bytes and a NUL after them, or null (and 0) for an event without any.
   * For an event of a session it holds the client's payload under "ClientData" and the session's shared data under
   * "SharedData", each only when there is one; for a message that came without a session it is the payload itself.
   * Dates are {"$date": seconds since 1970}, byte data {"$data": "base64"}. The text belongs to the daemon and is
   * valid until the function returns. Null: the adaptor takes no events, and each is an error line of the daemon.
   */
  int32_t (*sendMessageWithMethod)(void *context, uint16_t method, uint16_t respCode, const char *dict, size_t length);

  /*
   * Gives the instance back; its last call. On a thread of the daemon's choice. It is not called for instances that
   * are left when the process ends. May be null.
   */
  void (*release)(void *context);
} VelkReportingQuillAdaptor;

#if defined(__GNUC__)
#define VELK_REPORTING_QUILL_ADAPTOR_EXPORT __attribute__((visibility("default")))
#else
#define VELK_REPORTING_QUILL_ADAPTOR_EXPORT
#endif

/*
 * The one function that an adaptor exports: makes an instance. `version` is the daemon's version of this interface; an
 * adaptor that does not know it answers a failure. `adaptor` is all zeros, belongs to the daemon, and is copied when
 * the function has returned 0: keep no pointer to it. After a failure nothing is released.
 */
VELK_REPORTING_QUILL_ADAPTOR_EXPORT int32_t VelkReportingCreateQuillAdaptor(uint32_t version,
                                                                            VelkReportingQuillAdaptor *adaptor);

#ifdef __cplusplus
}
#endif

#endif
