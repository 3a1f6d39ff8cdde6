#!/usr/bin/env python3
"""Reports one event and waits until the daemon has posted it: report_event.py [CLIENT-TYPE]

Needs the installed library and nothing else. VELKREPORTING_LIBRARY names another file than the installed one.
"""

import ctypes
import json
import os
import sys
import threading

library = ctypes.CDLL(os.environ.get("VELKREPORTING_LIBRARY", "libvelkreporting.so.8"))

Handle = ctypes.c_void_p
StatesCallback = ctypes.CFUNCTYPE(None, Handle, ctypes.c_void_p)
FlushCallback = ctypes.CFUNCTYPE(None, Handle, ctypes.c_void_p)
DestroyFunction = ctypes.CFUNCTYPE(None, ctypes.c_void_p)


def function(name, result, *arguments):
    declared = getattr(library, "VelkReporting" + name)
    declared.restype = result
    declared.argtypes = arguments
    return declared


dictionary_from_json = function("DictionaryCreateFromJSON", Handle, ctypes.c_char_p, ctypes.POINTER(Handle))
value_release = function("ValueRelease", None, Handle)
array_count = function("ArrayGetCount", ctypes.c_size_t, Handle)
error_text = function("ErrorGetDescription", ctypes.c_char_p, Handle)
error_release = function("ErrorRelease", None, Handle)
client_create = function("ClientCreate", Handle, Handle, Handle, Handle)
client_start = function(
    "ClientStartConfiguration", None, Handle, StatesCallback, ctypes.c_void_p, DestroyFunction
)
client_release = function("ClientRelease", None, Handle)
send_message = function(
    "SendMessageWithError", ctypes.c_bool, Handle, ctypes.c_uint16, ctypes.c_uint16, Handle, ctypes.POINTER(Handle)
)
flush_messages = function(
    "FlushMessagesWithCompletion", None, Handle, FlushCallback, ctypes.c_void_p, DestroyFunction
)


def key(name):
    return ctypes.c_char_p.in_dll(library, "kVelkReporting" + name).value.decode()


class Value:
    """A dictionary of the library, for the length of a block."""

    def __init__(self, contents):
        self.contents = json.dumps(contents).encode()

    def __enter__(self):
        error = Handle()
        self.handle = dictionary_from_json(self.contents, ctypes.byref(error))
        if not self.handle:
            text = error_text(error).decode()
            error_release(error)
            raise ValueError(text)
        return self.handle

    def __exit__(self, *_):
        value_release(self.handle)


def answer_of(call, callback_type, read):
    """Makes a call whose callback comes on a thread of the library, and waits for what `read` makes of its argument."""
    answers = []
    destroyed = threading.Event()
    callback = callback_type(lambda handle, _: answers.append(read(handle)))
    # Callback objects must live until the library is done with them: it says so once, by this.
    destroy = DestroyFunction(lambda _: destroyed.set())
    call(callback, destroy)
    if not destroyed.wait(30):
        sys.exit("report_event.py: no answer came")
    return answers[0]


def main():
    client_type = int(sys.argv[1]) if len(sys.argv) > 1 else 9
    session = {
        key("SessionInfoClientType"): client_type,
        key("SessionInfoClientVersion"): 1,
        key("SessionInfoSessionID"): 9,
        key("SessionInfoBatchEvent"): True,
    }
    user = {key("UserInfoClientName"): "Example", key("UserInfoServiceName"): "report_event.py"}
    with Value(session) as session_info, Value(user) as user_info:
        client = client_create(session_info, user_info, None)
    if not client:
        sys.exit("report_event.py: the session info was refused")

    backends = answer_of(
        lambda callback, destroy: client_start(client, callback, None, destroy), StatesCallback, array_count
    )
    error = Handle()
    with Value({"answer": 42, "language": "Python"}) as payload:
        sent = send_message(client, 101, 1, payload, ctypes.byref(error))
    if error:
        print("report_event.py:", error_text(error).decode(), file=sys.stderr)
        error_release(error)
        sent = False
    flush_error = answer_of(
        lambda callback, destroy: flush_messages(client, callback, None, destroy),
        FlushCallback,
        lambda handle: error_text(handle).decode() if handle else None,
    )
    client_release(client)
    if not backends:
        sys.exit("report_event.py: no backend is enabled; is velkreportingd running?")
    if not sent or flush_error:
        sys.exit("report_event.py: " + (flush_error or "the event was not taken"))


if __name__ == "__main__":
    main()
