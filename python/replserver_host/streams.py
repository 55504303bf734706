"""sys.stdout, sys.stderr, sys.stdin and input() routed through the server.

The replacements stay installed for the whole run, not just while a command
runs: threads that a command started keep printing between commands, and the
server queues their text for the client. When the run ends the original
objects are put back, and the replacements (which code may still hold) write
to the original streams from then on; the server is not called again.
"""

import builtins
import io
import sys
import threading

# An unfinished line longer than this goes out without waiting for its end.
MAX_UNFINISHED = 4096
_LINE_ENDS = "\n\r"


class BridgeWriter(io.TextIOBase):
    """A text stream that sends each thread's output to the client line by line.

    Like the console's line-buffered streams, text goes out when a thread ends a
    line (or a carriage-return progress line) or flushes. Each thread collects
    its own unfinished line, so lines of different threads never mix. The lock
    guards only that bookkeeping and is never held while the server is called:
    the main thread may run a nested command (and print) while it waits in one.
    """

    encoding = "utf-8"
    errors = "strict"

    def __init__(self, bridge, is_error, name, fallback):
        super().__init__()
        self._bridge = bridge
        self._is_error = is_error
        self._name = name
        self._fallback = fallback
        self._lock = threading.Lock()
        self._unfinished = {}  # thread ident -> text after that thread's last line end
        self._attached = True

    @property
    def name(self):
        return self._name

    def writable(self):
        return True

    def isatty(self):
        return False

    def write(self, text):
        if not isinstance(text, str):
            raise TypeError("write() argument must be str, not " + type(text).__name__)
        ident = threading.get_ident()
        with self._lock:
            pending = self._unfinished.pop(ident, "") + text
            cut = max(pending.rfind(end) for end in _LINE_ENDS) + 1
            if len(pending) - cut > MAX_UNFINISHED:
                cut = len(pending)
            if cut < len(pending):
                self._unfinished[ident] = pending[cut:]
        self._send(pending[:cut])
        return len(text)

    def flush(self):
        """Sends the calling thread's unfinished line."""
        with self._lock:
            pending = self._unfinished.pop(threading.get_ident(), "")
        self._send(pending)

    def detach_from_server(self):
        """From now on writes go to the fallback stream, with any unfinished lines first."""
        with self._lock:
            self._attached = False
            leftovers = "".join(self._unfinished.values())
            self._unfinished.clear()
        self._send(leftovers)

    def _send(self, text):
        if not text:
            return
        if self._attached:
            self._bridge.print(text, self._is_error)
        elif self._fallback is not None:
            self._fallback.write(text)
            self._fallback.flush()


class BridgeReader(io.TextIOBase):
    """sys.stdin for the run: every line is asked of the client, without a prompt."""

    encoding = "utf-8"
    errors = "strict"

    def __init__(self, ask):
        super().__init__()
        self._ask = ask
        self._rest = ""  # what a size-limited read left of the last line

    @property
    def name(self):
        return "<stdin>"

    def readable(self):
        return True

    def isatty(self):
        return False

    def readline(self, size=-1):
        if not self._rest:
            line = self._ask(None)
            if line is None:
                return ""
            self._rest = line + "\n"
        if size is None or size < 0:
            size = len(self._rest)
        chunk, self._rest = self._rest[:size], self._rest[size:]
        return chunk

    def read(self, size=-1):
        chunks = []
        remaining = -1 if size is None or size < 0 else size
        while remaining != 0:
            chunk = self.readline(remaining)
            if not chunk:
                break
            chunks.append(chunk)
            if remaining > 0:
                remaining -= len(chunk)
        return "".join(chunks)


class Redirection:
    """Installs the replacements for a run (a context manager) and restores what was there."""

    def __init__(self, bridge, gate):
        self._bridge = bridge
        self._gate = gate
        self._saved = None
        self.stdout = None
        self.stderr = None

    def __enter__(self):
        self._saved = (sys.stdout, sys.stderr, sys.stdin, builtins.input)
        self.stdout = BridgeWriter(self._bridge, False, "<stdout>", sys.stdout)
        self.stderr = BridgeWriter(self._bridge, True, "<stderr>", sys.stderr)
        sys.stdout, sys.stderr = self.stdout, self.stderr
        sys.stdin = BridgeReader(self._ask)
        builtins.input = self._input
        return self

    def __exit__(self, *exc_info):
        sys.stdout, sys.stderr, sys.stdin, builtins.input = self._saved
        self.stdout.detach_from_server()
        self.stderr.detach_from_server()

    def flush_current_thread(self):
        """Sends what the calling thread left unfinished on stdout and stderr."""
        self.stdout.flush()
        self.stderr.flush()

    def _input(self, prompt=""):
        """input() for the run: the prompt goes to the client along with the request."""
        line = self._ask(str(prompt))
        if line is None:
            raise EOFError
        return line

    def _ask(self, prompt):
        # As the console does, show the output so far before waiting for an answer.
        self.flush_current_thread()
        line = self._bridge.read_line(prompt)
        self._gate.raise_pending()
        return line
