"""The interpreter state behind the commands: one namespace, run like the console."""

import __future__
import ast
import builtins
import os
import rlcompleter
import traceback
import types

# Tracebacks name user code the way the interactive console does.
SOURCE_NAME = "<stdin>"

# The characters that end a word for completion: the set Python's own
# readline setup uses, so a prefix splits where the console would split it.
WORD_DELIMITERS = frozenset(" \t\n`~!@#$%^&*()-=+[{]}\\|;:'\",<>/?")

_PACKAGE_DIR = os.path.dirname(os.path.abspath(__file__))
_FUTURE_FLAGS = [getattr(__future__, name).compiler_flag for name in __future__.all_feature_names]


class Interpreter:
    """Runs source text in one persistent module namespace."""

    def __init__(self, module=None):
        self.module = module if module is not None else types.ModuleType("__main__")
        self.namespace = self.module.__dict__
        # __future__ features switched on by earlier commands stay on, as in the console.
        self._flags = 0

    def run_exec(self, source):
        """Runs statements; returns the value of a final expression statement, else None."""
        tree = self._compile(source, "exec", ast.PyCF_ONLY_AST)
        last = tree.body.pop() if tree.body and isinstance(tree.body[-1], ast.Expr) else None
        exec(self._compile(tree, "exec"), self.namespace)
        if last is None:
            return None
        value = eval(self._compile(ast.Expression(body=last.value), "eval"), self.namespace)
        if value is not None:
            builtins._ = value  # what sys.displayhook does for a displayed value
        return value

    def run_eval(self, source):
        """Evaluates one expression; leading blanks are ignored, as by eval()."""
        return eval(self._compile(source.lstrip(" \t"), "eval"), self.namespace)

    def complete(self, prefix):
        """Sorted candidates for the last word of prefix, each as the whole completed prefix."""
        start = len(prefix)
        while start > 0 and prefix[start - 1] not in WORD_DELIMITERS:
            start -= 1
        word = prefix[start:]
        if not word:
            return []
        completer = rlcompleter.Completer(self.namespace)
        matches = []
        while True:
            match = completer.complete(word, len(matches))
            if match is None:
                break
            matches.append(match)
        return [prefix[:start] + match for match in sorted(set(matches))]

    def format_failure(self, exc):
        """The traceback text the console would print for exc."""
        report = traceback.TracebackException(type(exc), exc, exc.__traceback__)
        _hide_own_frames(report)
        return "".join(report.format())

    def _compile(self, source, mode, extra_flags=0):
        code = compile(source, SOURCE_NAME, mode, self._flags | extra_flags, dont_inherit=True)
        if isinstance(code, types.CodeType):
            for flag in _FUTURE_FLAGS:
                if code.co_flags & flag:
                    self._flags |= flag
        return code


def _hide_own_frames(report):
    """Drops this package's frames from a traceback report and the ones chained to it.

    They are what the console's own C code would be: the code that ran the
    command, and the input() and stream replacements that user code called.
    """
    report.stack = traceback.StackSummary.from_list(
        [frame for frame in report.stack if not _is_own_file(frame.filename)])
    linked = [report.__cause__, report.__context__] + list(getattr(report, "exceptions", None) or [])
    for other in linked:
        if other is not None:
            _hide_own_frames(other)


def _is_own_file(filename):
    return not filename.startswith("<") and os.path.dirname(os.path.abspath(filename)) == _PACKAGE_DIR
