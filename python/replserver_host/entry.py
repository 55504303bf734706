"""Command line: python -m replserver_host [--dll PATH] <client-text> <client-pid> <pipe-handle>"""

import argparse
import sys

from .server import run_server

# Exit statuses of our own; KxReplRun's results (0 to 4) pass through unchanged.
EXIT_USAGE = 64
EXIT_UNAVAILABLE = 69


class _Parser(argparse.ArgumentParser):
    def error(self, message):
        # argparse's own status (2) would read as KxReplRun's "client cannot be attached".
        self.print_usage(sys.stderr)
        self.exit(EXIT_USAGE, "{}: error: {}\n".format(self.prog, message))


def _unsigned(bits):
    def parse(text):
        if not (text.isascii() and text.isdigit()):  # no sign, no 0x, no blanks
            raise argparse.ArgumentTypeError("not a decimal number: {!r}".format(text))
        value = int(text)
        if value >= 1 << bits:
            raise argparse.ArgumentTypeError("too large: {}".format(text))
        return value
    parse.__name__ = "decimal number"
    return parse


def parse_arguments(argv):
    parser = _Parser(
        prog="python -m replserver_host",
        description="Serve this Python interpreter to a ReplServer client until it quits.")
    parser.add_argument("--dll", metavar="PATH",
                        help="ReplServer.dll to load (default: the one shipped with this package)")
    parser.add_argument("client", metavar="client-text",
                        help="the client's marshalled interface, as Base64 text")
    parser.add_argument("pid", metavar="client-pid", type=_unsigned(32),
                        help="the client's process id")
    parser.add_argument("pipe", metavar="pipe-handle", type=_unsigned(64),
                        help="handle of the interrupt pipe's read end, inherited from the client")
    return parser.parse_args(argv)


def main(argv=None):
    args = parse_arguments(sys.argv[1:] if argv is None else argv)
    if sys.platform != "win32":
        print("replserver_host: ReplServer.dll runs on Windows only", file=sys.stderr)
        return EXIT_UNAVAILABLE
    from . import native

    path = args.dll or native.default_dll_path()
    try:
        dll = native.load(path)
    except OSError as exc:
        print("replserver_host: cannot load {}: {}".format(path, exc), file=sys.stderr)
        return EXIT_UNAVAILABLE
    result = run_server(dll, args.client, args.pid, args.pipe,
                        native.python_module_handle(), native.com_module_handle())
    native.drain_messages()
    return result
