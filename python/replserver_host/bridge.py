"""Python-shaped access to the server's output, input and result functions.

The object wrapped here is normally the loaded ReplServer.dll (see native.py),
but anything with the same KxRepl* callables will do, which is how the tests
record what the server would have been asked to do.
"""

from .interrupts import shielded


class Bridge:
    def __init__(self, dll):
        self._dll = dll

    def print(self, text, is_error):
        """Sends text to the client's output (error output when is_error); any thread."""
        if text:
            self._dll.KxReplPrint(text, 1 if is_error else 0)

    @shielded
    def read_line(self, prompt):
        """Asks the client for one line, returned without a line end; None at end
        of input. Main thread only.

        The server hands the answer over as a string that we own: it is freed
        here on every path, and the interrupt gate holds back a KeyboardInterrupt
        until this function is done, so that none can get between the two.
        """
        answer = self._dll.KxReplGetUserInput(prompt)
        if not answer:
            return None
        try:
            text = self._dll.KxReplGetString(answer) or ""
        finally:
            self._dll.KxReplFreeString(answer)
        return _without_line_end(text)

    def set_result(self, result_slot, text):
        """Stores a command's result (or failure) text in the server's result slot."""
        self._dll.KxReplSetResult(result_slot, text)

    def quit(self):
        """Ends the run once the current command has returned. Main thread only."""
        self._dll.KxReplQuit()


def _without_line_end(text):
    if text.endswith("\n"):
        text = text[:-1]
    if text.endswith("\r"):
        text = text[:-1]
    return text
