"""Serves this Python interpreter to a ReplServer client over COM.

Run as ``python -m replserver_host <client-text> <client-pid> <pipe-handle>``;
the client starts that command itself. See README.md for the commands a client
can send and how output and input behave.
"""

__version__ = "1.0.0"
