"""The C shapes of the two command callbacks that KxReplRun receives.

Both are C-convention functions returning int (0 = success). The server calls
them on the main thread without holding the GIL; a ctypes callback takes the
GIL itself before it runs Python code and releases it when it returns.

ExecProc(BSTR Command, BSTR Argument, BSTR* pResult)
    Argument may be NULL (None here). A BSTR is a pointer to NUL-terminated
    UTF-16 text, so c_wchar_p reads it. The result slot is passed on untouched
    to KxReplSetResult, hence a plain address.

ExecComProc(BSTR Command, PyObject* Argument, PyObject** pResult)
    The server owns Argument and drops it after the call; ctypes hands the
    callback a reference of its own and gives it back afterwards, so the count
    is unchanged. *pResult must receive a NEW reference: the server converts
    the object to a VARIANT and then drops that reference with Py_DecRef.
"""

import ctypes

EXEC_PROC = ctypes.CFUNCTYPE(ctypes.c_int, ctypes.c_wchar_p, ctypes.c_wchar_p, ctypes.c_void_p)
EXEC_COM_PROC = ctypes.CFUNCTYPE(ctypes.c_int, ctypes.c_wchar_p, ctypes.py_object, ctypes.c_void_p)


def make_callbacks(host, with_com):
    """C function pointers for host's two callbacks.

    Without COM support the ExecCom pointer is NULL, and the server answers
    ExecCom with E_NOTIMPL. The caller must keep the returned objects alive for
    as long as the server may call them.
    """
    exec_proc = EXEC_PROC(host.exec_proc)
    exec_com_proc = EXEC_COM_PROC(host.exec_com_proc) if with_com else EXEC_COM_PROC()
    return exec_proc, exec_com_proc


def store_new_reference(slot_address, obj):
    """Writes a new reference to obj into the PyObject* variable at slot_address."""
    ctypes.pythonapi.Py_IncRef(ctypes.py_object(obj))
    # In CPython an object's id is its address, i.e. its PyObject*.
    ctypes.c_void_p.from_address(slot_address).value = id(obj)
