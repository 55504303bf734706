"""One server run: everything around the call of KxReplRun."""

import contextlib
import sys
import threading

from .bridge import Bridge
from .callbacks import make_callbacks
from .commands import CommandHost
from .interpreter import Interpreter
from .interrupts import InterruptGate
from .streams import Redirection


def run_server(dll, client_text, client_pid, interrupt_pipe, python_module, com_module,
               interpreter=None):
    """Serves the client until the run ends; returns KxReplRun's result.

    Must run on Python's main thread: the server makes the calling thread the
    one that runs every command, and its interrupts (PyErr_SetInterrupt) reach
    Python's main thread only.
    """
    if threading.current_thread() is not threading.main_thread():
        raise RuntimeError("run_server must be called on the main thread")
    interpreter = interpreter if interpreter is not None else Interpreter()
    bridge = Bridge(dll)
    gate = InterruptGate()
    redirection = Redirection(bridge, gate)
    host = CommandHost(interpreter, bridge, redirection, gate)
    # Kept in locals for the whole call: the server holds only the raw pointers.
    exec_proc, exec_com_proc = make_callbacks(host, with_com=com_module is not None)
    with gate, redirection, _as_main_module(interpreter.module):
        return dll.KxReplRun(client_text.encode("utf-8"), client_pid, python_module, com_module,
                             interrupt_pipe, exec_proc, exec_com_proc)


@contextlib.contextmanager
def _as_main_module(module):
    """Makes the command namespace sys.modules['__main__'] for the run, as in
    the console, so that `import __main__` and pickling of classes defined in
    commands find it."""
    saved = sys.modules.get("__main__")
    sys.modules["__main__"] = module
    try:
        yield
    finally:
        if saved is None:
            del sys.modules["__main__"]
        else:
            sys.modules["__main__"] = saved
