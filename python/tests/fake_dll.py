"""A recording stand-in for ReplServer.dll, and a test case that serves through it."""

import ctypes
import faulthandler
import sys
import threading
import unittest
from collections import namedtuple

from replserver_host.native import PROTOTYPES
from replserver_host.server import run_server

Call = namedtuple("Call", "name args thread")

CLIENT_TEXT = "QUJD"
CLIENT_PID = 4242
PIPE_HANDLE = 77
PYTHON_MODULE = 0x1000
COM_MODULE = 0x2000


class RecordingDll:
    """Records every call, checks it against the DLL's declared prototypes and
    plays the server's side: strings handed out and freed, results stored.

    Anything the real DLL would not accept (an argument its prototype rejects,
    a string read or freed after it was freed) lands in `violations`.
    """

    def __init__(self, answers=()):
        self.calls = []
        self.violations = []
        self.answers = list(answers)  # the client's answers to input requests; None = end of input
        self.on_input = None  # optional hook, called on the main thread just before an answer is returned
        self.on_print = None  # optional hook, called with (text, is_error) after a print is recorded
        self.results = {}  # result slot address -> text of the last KxReplSetResult
        self.client = None  # plays the client inside KxReplRun: client(driver) -> result
        self.main_thread = threading.get_ident()
        self._live = {}  # handle -> text of strings handed out and not yet freed
        self._next_handle = 0x10000
        self._lock = threading.Lock()

    # -- the exports -------------------------------------------------------

    def KxReplRun(self, *args):
        self._record("KxReplRun", args)
        driver = ClientDriver(self, args[5], args[6])
        return self.client(driver) if self.client else 0

    def KxReplPrint(self, text, is_error):
        self._record("KxReplPrint", (text, is_error))
        if self.on_print:
            self.on_print(text, is_error)

    def KxReplGetUserInput(self, prompt):
        self._record("KxReplGetUserInput", (prompt,))
        if threading.get_ident() != self.main_thread:
            return None  # the server answers input requests on the main thread only
        answer = self.answers.pop(0) if self.answers else None
        handle = None
        if answer is not None:
            with self._lock:
                handle = self._next_handle
                self._next_handle += 8
                self._live[handle] = answer
        if self.on_input:
            self.on_input()
        return handle

    def KxReplGetString(self, handle):
        self._record("KxReplGetString", (handle,))
        with self._lock:
            if handle not in self._live:
                self.violations.append("KxReplGetString of a string not handed out or freed: %r" % handle)
                return None
            return self._live[handle]

    def KxReplFreeString(self, handle):
        self._record("KxReplFreeString", (handle,))
        with self._lock:
            if handle and self._live.pop(handle, None) is None:
                self.violations.append("KxReplFreeString of a string not handed out or freed: %r" % handle)

    def KxReplSetResult(self, slot, text):
        self._record("KxReplSetResult", (slot, text))
        self.results[slot] = text

    def KxReplQuit(self):
        self._record("KxReplQuit", ())

    # -- what the tests read -------------------------------------------------

    def named(self, name):
        return [call for call in self.calls if call.name == name]

    def printed(self, is_error=False):
        """Text sent to stdout (or stderr), joined in call order."""
        return "".join(c.args[0] for c in self.named("KxReplPrint") if bool(c.args[1]) == is_error)

    def live_strings(self):
        with self._lock:
            return dict(self._live)

    def _record(self, name, args):
        restype, argtypes = PROTOTYPES[name]
        if len(args) != len(argtypes):
            self.violations.append("%s called with %d arguments" % (name, len(args)))
        for argtype, value in zip(argtypes, args):
            try:
                argtype.from_param(value)
            except (TypeError, ctypes.ArgumentError) as exc:
                self.violations.append("%s: %r does not fit %s: %s" % (name, value, argtype.__name__, exc))
        with self._lock:
            self.calls.append(Call(name, args, threading.get_ident()))


class ClientDriver:
    """Calls the two command callbacks through their C pointers, as the server does."""

    def __init__(self, dll, exec_proc, exec_com_proc):
        self.dll = dll
        self.exec_proc = exec_proc
        self.exec_com_proc = exec_com_proc

    def exec(self, command, argument=None):
        """Returns (callback result, result text)."""
        slot = ctypes.c_void_p()
        rc = self.exec_proc(command, argument, ctypes.addressof(slot))
        return rc, self.dll.results.pop(ctypes.addressof(slot), None)

    def exec_com(self, command, argument):
        """Returns (callback result, result object); drops the reference the
        callback handed over, as the server does after converting it."""
        rc, slot = self.exec_com_raw(command, argument)
        if not slot.value:
            return rc, None
        value = ctypes.py_object.from_address(ctypes.addressof(slot)).value
        ctypes.pythonapi.Py_DecRef(ctypes.py_object(value))
        return rc, value

    def exec_com_raw(self, command, argument):
        """Returns (callback result, the PyObject* slot as the callback left it)."""
        slot = ctypes.c_void_p()
        rc = self.exec_com_proc(command, argument, ctypes.addressof(slot))
        return rc, slot


# A test that hangs (a deadlock between the main thread and a printing thread,
# a command that is never interrupted) ends the whole run after this long.
HANG_TIMEOUT = 30


class ServerTestCase(unittest.TestCase):
    """Runs run_server against a RecordingDll whose KxReplRun plays the client."""

    def setUp(self):
        faulthandler.dump_traceback_later(HANG_TIMEOUT, exit=True, file=sys.__stderr__)
        self.addCleanup(faulthandler.cancel_dump_traceback_later)

    def serve(self, client, dll=None, com=True):
        """Runs a server whose client is client(driver); returns (dll, run result)."""
        dll = dll if dll is not None else RecordingDll()
        dll.client = client
        self.addCleanup(self._check_protocol, dll)
        result = run_server(dll, CLIENT_TEXT, CLIENT_PID, PIPE_HANDLE, PYTHON_MODULE,
                            COM_MODULE if com else None)
        return dll, result

    def run_commands(self, *commands, dll=None):
        """Runs (command, argument) pairs through ExecProc; returns their (rc, text) and the dll."""
        outcomes = []

        def client(driver):
            for command, argument in commands:
                outcomes.append(driver.exec(command, argument))
            return 0

        dll, _ = self.serve(client, dll)
        return outcomes, dll

    def run_one(self, command, argument, dll=None):
        outcomes, dll = self.run_commands((command, argument), dll=dll)
        return outcomes[0]

    def _check_protocol(self, dll):
        self.assertEqual(dll.violations, [])
        self.assertEqual(dll.live_strings(), {}, "strings handed over but never freed")
