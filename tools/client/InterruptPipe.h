#pragma once
// The interrupt pipe: an anonymous pipe whose read end a host process
// inherits (its handle value goes on the host's command line) and whose
// write end the client keeps to send one-byte commands: 'a' interrupts the
// running command, 'k' also every other Python thread.
#include <windows.h>

#include <string>

#include "common/Raii.h"

class CInterruptPipe
{
public:
    static constexpr char kInterrupt = 'a';
    static constexpr char kInterruptAll = 'k';

    CInterruptPipe() = default;
    CInterruptPipe(const CInterruptPipe&) = delete;
    CInterruptPipe& operator=(const CInterruptPipe&) = delete;

    // Makes the pipe: read end inheritable, write end not. Replaces a
    // previous pipe.
    HRESULT Create();
    HANDLE ReadHandle() const noexcept { return m_hRead.Get(); }
    HANDLE WriteHandle() const noexcept { return m_hWrite.Get(); }
    // The read end's handle value in decimal, as the host expects it.
    std::wstring ReadHandleText() const;

    // Writes one command byte. False when the pipe is closed or broken.
    // Thread-safe (a console's Ctrl+C handler runs on its own thread).
    bool Send(char chCommand) const noexcept;
    // Writes the bytes in one WriteFile (e.g. "ak" to test one read that
    // returns two commands).
    bool SendRaw(const void* pvData, DWORD cbData) const noexcept;
    bool SendRaw(const std::string& strData) const noexcept;

    // Closing the write end ends the host's reads. Closing our copy of the
    // read end once the host has started lets writes fail when the host
    // is gone instead of filling the pipe.
    void CloseWrite() noexcept { m_hWrite.Reset(); }
    void CloseRead() noexcept { m_hRead.Reset(); }

private:
    CHandle m_hRead;
    CHandle m_hWrite;
};
