"""The commands a client can send, and the two command callbacks of the server.

Exec carries text both ways; ExecCom carries Python objects, which the server
converts from and to VARIANTs. The same three commands serve both:

    exec      run statements; the result is the value of a final expression
    eval      evaluate one expression
    complete  completion candidates for the last word of a prefix

A failed command's text is its traceback as the console prints it; a command
that raises SystemExit (exit(), sys.exit()) ends the run once it has returned.
"""

from . import interrupts
from .callbacks import store_new_reference

SUCCEEDED = 0
FAILED = 1


class CommandFailed(Exception):
    """A command that could not start; the message is the whole failure text."""


def _shown(value):
    return "" if value is None else repr(value)


def _same(value):
    return value


# How each command's value becomes its result: for Exec the text the console
# would show, for ExecCom the objects themselves.
TEXT_RESULTS = {"exec": _shown, "eval": repr, "complete": "\n".join}
OBJECT_RESULTS = {"exec": _same, "eval": _same, "complete": tuple}


class CommandHost:
    """Runs client commands in one interpreter while the server run lasts."""

    def __init__(self, interpreter, bridge, redirection, gate):
        self._interpreter = interpreter
        self._bridge = bridge
        self._redirection = redirection
        self._gate = gate
        self._commands = {
            "exec": interpreter.run_exec,
            "eval": interpreter.run_eval,
            "complete": interpreter.complete,
        }

    def exec_proc(self, command, argument, result_slot):
        """The ExecProc callback: BSTR command and argument, BSTR* result slot."""
        try:
            succeeded, text = self.run(command, argument, TEXT_RESULTS)
            self._bridge.set_result(result_slot, text)
            return SUCCEEDED if succeeded else FAILED
        except BaseException:
            # Not the user's code failing (run() reports that), but an interrupt
            # that hit the failure handling or the final flush, or a result that
            # could not be stored. After an interrupt the server answers E_ABORT
            # whatever we return.
            return FAILED

    def exec_com_proc(self, command, argument, result_slot):
        """The ExecComProc callback: BSTR command, borrowed PyObject* argument,
        PyObject** result slot that receives a new reference."""
        try:
            succeeded, value = self.run(command, argument, OBJECT_RESULTS)
            store_new_reference(result_slot, value)
            return SUCCEEDED if succeeded else FAILED
        except BaseException:
            return FAILED  # as in exec_proc; an empty slot makes the server fail the call

    @interrupts.command_scope
    def run(self, command, argument, results):
        """Runs one command; returns (succeeded, result or failure text).

        results is TEXT_RESULTS or OBJECT_RESULTS."""
        self._gate.clear_pending()
        try:
            return True, self._dispatch(command, argument, results)
        except SystemExit:
            self._bridge.quit()
            return True, results["exec"](None)
        except CommandFailed as exc:
            return False, str(exc)
        except BaseException as exc:  # KeyboardInterrupt included: the command failed
            return False, self._interpreter.format_failure(exc)
        finally:
            self._redirection.flush_current_thread()

    def _dispatch(self, command, argument, results):
        run = self._commands.get(command)
        if run is None:
            known = ", ".join(sorted(self._commands))
            raise CommandFailed("Unknown command {!r}; the commands are: {}.".format(command, known))
        if argument is None:
            argument = ""  # a missing argument counts as empty text
        elif not isinstance(argument, str):
            raise CommandFailed("The command {!r} needs a text argument, not {}.".format(
                command, type(argument).__name__))
        return results[command](run(argument))
