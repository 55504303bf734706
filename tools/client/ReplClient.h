#pragma once
// The client library: everything a program needs to drive a ReplServer in a
// host process over COM automation.
//
//   ClientObject.h   CReplClientObject, the client's IDispatch (IReplClient)
//   Marshal.h        MarshalToBase64: the client text; Base64
//   InterruptPipe.h  CInterruptPipe: the pipe for 'a' and 'k'
//   HostProcess.h    CHostProcess: start or attach to the host, debug output
//   MessagePump.h    waits that keep serving COM calls
//   ServerCalls.h    CallExec, CallExecCom, CallQuit with EXCEPINFO captured
//   ReplSession.h    CReplSession: the whole start-to-finish sequence
#include "client/ClientObject.h"
#include "client/HostProcess.h"
#include "client/InterruptPipe.h"
#include "client/Marshal.h"
#include "client/MessagePump.h"
#include "client/ReplSession.h"
#include "client/ServerCalls.h"
