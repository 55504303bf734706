#pragma once
// The output and input bridge inside the DLL (the exported side is in
// KxRepl.h).

// Sends what other threads queued to the client, in order, then empties
// the queue. Main thread only; the main loop calls it before every wait.
// Does nothing while no run's queue exists.
void FlushQueuedOutput() noexcept;
