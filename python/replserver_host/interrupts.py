"""What the server's interrupt does to Python code on the main thread.

The server interrupts a command with PyErr_SetInterrupt, which reaches Python
as SIGINT at the next point where the main thread checks for signals. That can
be too late: the command may have finished, and the interrupt would then hit
the next command, or this package's own code between commands. It can also
land where an exception would leak a string the server handed over. So while
a run lasts, SIGINT goes to an InterruptGate, which looks at where the main
thread is:

- inside a function marked @shielded: the interrupt is remembered and raised by
  raise_pending() once that function is done;
- inside a function marked @command_scope: KeyboardInterrupt, as usual;
- anywhere else (no command runs): it is dropped. The server has already
  answered the interrupted command with E_ABORT.

The decision walks the interrupted frame's callers instead of keeping a
counter, because the code that would update a counter can itself be
interrupted before it gets to run.
"""

import signal
import threading

_COMMAND_CODES = set()
_SHIELDED_CODES = set()


def command_scope(func):
    """Marks func as running a command: an interrupt inside it raises KeyboardInterrupt."""
    _COMMAND_CODES.add(func.__code__)
    return func


def shielded(func):
    """Marks func as not to be interrupted halfway; the interrupt waits until it returns."""
    _SHIELDED_CODES.add(func.__code__)
    return func


class InterruptGate:
    """The SIGINT handler for the duration of a run."""

    def __init__(self):
        self._pending = False
        self._previous = None

    def __call__(self, signum, frame):
        while frame is not None:
            if frame.f_code in _SHIELDED_CODES:
                self._pending = True
                return
            if frame.f_code in _COMMAND_CODES:
                self._pending = False
                raise KeyboardInterrupt
            frame = frame.f_back

    def clear_pending(self):
        """Forgets an interrupt deferred by an earlier command."""
        self._pending = False

    def raise_pending(self):
        """Raises the KeyboardInterrupt that arrived during a shielded call, if any.

        Only on the main thread, where the interrupt was meant to land."""
        if self._pending and threading.current_thread() is threading.main_thread():
            self._pending = False
            raise KeyboardInterrupt

    def __enter__(self):
        if threading.current_thread() is not threading.main_thread():
            raise RuntimeError("the interrupt gate needs the main thread, where Python handles signals")
        self._previous = signal.signal(signal.SIGINT, self)
        return self

    def __exit__(self, *exc_info):
        signal.signal(signal.SIGINT, self._previous)
        self._pending = False
