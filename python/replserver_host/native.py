"""Loading ReplServer.dll, and the other Windows-only pieces of a run.

Everything that needs Windows is in this module and runs only when called;
importing it anywhere is safe, so the prototype table can be checked anywhere.
"""

import ctypes
import os
import struct
import sys
import time

from .callbacks import EXEC_COM_PROC, EXEC_PROC

DLL_NAME = "ReplServer.dll"

_DWORD = ctypes.c_uint32
_BOOL = ctypes.c_int
_HANDLE = ctypes.c_void_p  # also HMODULE
_BSTR = ctypes.c_void_p  # kept opaque where we must free it ourselves

# name -> (result type, argument types) of every function the package calls.
PROTOTYPES = {
    # client text (Base64), client pid, Python DLL, COM-support DLL, interrupt pipe, callbacks
    "KxReplRun": (ctypes.c_int, [ctypes.c_char_p, _DWORD, _HANDLE, _HANDLE, _HANDLE,
                                 EXEC_PROC, EXEC_COM_PROC]),
    "KxReplPrint": (None, [ctypes.c_wchar_p, _BOOL]),
    "KxReplGetUserInput": (_BSTR, [ctypes.c_wchar_p]),
    "KxReplGetString": (ctypes.c_wchar_p, [_BSTR]),  # copied out into a str at once
    "KxReplFreeString": (None, [_BSTR]),
    "KxReplQuit": (None, []),
    "KxReplSetResult": (None, [ctypes.c_void_p, ctypes.c_wchar_p]),
}

# How long to keep answering window messages after KxReplRun returns: COM's
# reply to the client call that ended the run may still be on its way out, and
# leaving at once can make that call fail in the client.
DRAIN_SECONDS = 0.25


def default_dll_path():
    """The DLL of this interpreter's bitness: <package>/x64 or x86, else <package> itself."""
    here = os.path.dirname(os.path.abspath(__file__))
    arch_dir = os.path.join(here, "x64" if struct.calcsize("P") == 8 else "x86")
    for folder in (arch_dir, here):
        candidate = os.path.join(folder, DLL_NAME)
        if os.path.isfile(candidate):
            return candidate
    return os.path.join(arch_dir, DLL_NAME)


def load(path):
    """Loads the DLL and declares its functions. Raises OSError if it cannot be loaded.

    CDLL, not WinDLL: the exports use the C calling convention. And CDLL, not
    PyDLL: ctypes releases the GIL during each call, which the server needs,
    since its own threads take the GIL while Python waits in KxReplRun or in
    a print.
    """
    dll = ctypes.CDLL(path)
    for name, (restype, argtypes) in PROTOTYPES.items():
        function = getattr(dll, name)
        function.restype = restype
        function.argtypes = argtypes
    return dll


def python_module_handle():
    """The module handle of the running Python DLL."""
    return sys.dllhandle


def com_module_handle():
    """The module handle of pywin32's pythoncomXY.dll, or None without pywin32."""
    try:
        import pythoncom  # pywin32 puts the DLL itself in sys.modules under this name
    except ImportError:
        return None
    kernel32 = ctypes.WinDLL("kernel32", use_last_error=True)
    get_module_handle = kernel32.GetModuleHandleW
    get_module_handle.restype = ctypes.c_void_p
    get_module_handle.argtypes = [ctypes.c_wchar_p]
    return get_module_handle(pythoncom.__file__) or None


def drain_messages(seconds=DRAIN_SECONDS):
    """Dispatches this thread's window messages for a while (also removes the
    WM_QUIT that ended the run)."""
    from ctypes import wintypes

    user32 = ctypes.WinDLL("user32")
    peek = user32.PeekMessageW
    peek.argtypes = [ctypes.POINTER(wintypes.MSG), wintypes.HWND, wintypes.UINT,
                     wintypes.UINT, wintypes.UINT]
    msg = wintypes.MSG()
    deadline = time.monotonic() + seconds
    while time.monotonic() < deadline:
        while peek(ctypes.byref(msg), None, 0, 0, 1):  # PM_REMOVE
            user32.TranslateMessage(ctypes.byref(msg))
            user32.DispatchMessageW(ctypes.byref(msg))
        time.sleep(0.01)
