/*
 * A diagnostics adaptor that writes each event as a line to the file that QUILL_ADAPTOR_FILE names, or, without it,
 * counts them. Build it as a shared object, install it where only root can write, and name it in adaptors.conf:
 *
 *     cc -std=c11 -shared -fPIC -I DIRECTORY_OF_THE_HEADERS -o quill.so quill_adaptor.c
 */
#define _POSIX_C_SOURCE 200809L

#include "platform/VelkReportingQuillAdaptor.h"

#include <errno.h>
#include <fcntl.h>
#include <inttypes.h>
#include <stdio.h>
#include <stdlib.h>
#include <unistd.h>

/* One for each session. Its calls never overlap, so it needs no lock. */
struct instance {
  int file; /* -1: none */
  uint64_t events;
};

/* In one write, so that the lines of several instances stay whole. */
static int32_t write_line(int file, uint16_t method, uint16_t respCode, const char *dict, size_t length) {
  const size_t room = length + sizeof "65535 65535 null\n";
  char *const line = malloc(room);
  if (line == NULL) return ENOMEM;
  const int size = snprintf(line, room, "%" PRIu16 " %" PRIu16 " %s\n", method, respCode, dict != NULL ? dict : "null");
  const ssize_t written = write(file, line, (size_t)size);
  const int32_t status = written == size ? 0 : EIO;
  free(line);
  return status;
}

static int32_t send_message(void *context, uint16_t method, uint16_t respCode, const char *dict, size_t length) {
  struct instance *const self = context;
  ++self->events;
  return self->file < 0 ? 0 : write_line(self->file, method, respCode, dict, length);
}

static void release(void *context) {
  struct instance *const self = context;
  if (self->file >= 0) close(self->file);
  free(self);
}

int32_t VelkReportingCreateQuillAdaptor(uint32_t version, VelkReportingQuillAdaptor *adaptor) {
  if (version != VELK_REPORTING_QUILL_ADAPTOR_VERSION) return ENOTSUP;
  struct instance *const self = calloc(1, sizeof *self);
  if (self == NULL) return ENOMEM;
  const char *const path = getenv("QUILL_ADAPTOR_FILE");
  self->file = path != NULL ? open(path, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600) : -1;
  if (path != NULL && self->file < 0) {
    const int32_t error = errno;
    free(self);
    return error;
  }
  adaptor->context = self;
  adaptor->sendMessageWithMethod = send_message;
  adaptor->release = release;
  return 0;
}
