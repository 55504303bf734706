// Temporary body until the worker threads land.
#include "host/RunServer.h"

int RunServer(IDispatch*, HANDLE hClientProcess, HMODULE, HMODULE, HANDLE, ExecProc, ExecComProc)
{
    ::CloseHandle(hClientProcess);
    return 3;
}
