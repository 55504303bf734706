#pragma once
// The process-wide state of a server run that the host shares with the
// bridge and the worker threads: which thread is the main thread, and the
// queue that carries output of other threads to it. One run at a time.
#include <windows.h>

#include <atomic>
#include <deque>
#include <string>

// The thread that entered KxReplRun; 0 before the first run. Set by the
// main loop before the worker threads start, kept after the run ends.
extern std::atomic<DWORD> g_dwMainThreadId;

inline bool IsMainThread() noexcept
{
    return ::GetCurrentThreadId() == g_dwMainThreadId.load();
}

// One piece of output queued by a thread other than the main thread.
struct OutputRecord
{
    std::wstring Text;  // the record's own copy, without the terminating NUL
    bool bIsError;
};

// Records in arrival order; appended at the back, sent from the front.
// Every access holds g_csOutputQueue.
extern std::deque<OutputRecord> g_OutputQueue;
extern CRITICAL_SECTION g_csOutputQueue;

// The lock exists only between these two calls, which the main loop makes
// on the main thread:
//   OpenOutputQueue()  once the worker threads run and before the server
//                      object is created; false when the lock cannot be
//                      made (the run cannot go on).
//   CloseOutputQueue() after the loop ended; discards what is still queued
//                      without sending it and deletes the lock.
// Output of other threads is queued only while the queue is open; outside
// that window it is dropped, and no thread touches the lock.
bool OpenOutputQueue() noexcept;
void CloseOutputQueue() noexcept;

// Queues a copy of pszText on behalf of a thread other than the main
// thread. Returns false when the queue is closed. Raises std::bad_alloc
// (or length_error) when the copy cannot be made; nothing is queued then.
bool QueueOutput(const wchar_t* pszText, bool bIsError);

// Main thread only: whether the lock exists now.
bool IsOutputQueueOpen() noexcept;

// A failure report for places that must go on after it (LogError raises
// when even the line cannot be allocated).
void LogErrorNoThrow(const char* pszMessage) noexcept;
