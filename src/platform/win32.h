// The Win32 and MFC surface the library uses: named mutexes, Sleep, threads,
// and the runtime library's rand. Emulated on pthreads.
//
//  - Named mutexes are recursive and owned by thread, as Win32's are. A name
//    names one mutex per process, not per machine: processes of this library
//    on one machine do not serialise each other's network threads.
//    ReleaseMutex by a thread that does not own the mutex fails and changes
//    nothing. Closing one handle leaves the mutex usable through the others.
//  - AfxBeginThread starts a detached thread at once; the CWinThread it
//    returns frees itself when the thread ends. It answers null if the thread
//    cannot be started.
//  - rand yields 0 to 32767 from the same linear congruential generator as the
//    Microsoft runtime, one state per thread starting at seed 1; srand seeds
//    the calling thread, so runs are repeatable. rand(state) steps the same
//    generator on a state of the caller's own, whichever thread calls.
#pragma once

#include "vardel_platform.h"

namespace platform {

constexpr DWORD INFINITE = 0xFFFFFFFFu;
constexpr DWORD WAIT_OBJECT_0 = 0;
constexpr DWORD WAIT_ABANDONED = 0x80;
constexpr DWORD WAIT_TIMEOUT = 258;
constexpr DWORD WAIT_FAILED = 0xFFFFFFFFu;

struct SECURITY_ATTRIBUTES;

HANDLE CreateMutexA(SECURITY_ATTRIBUTES* lpMutexAttributes, BOOL bInitialOwner, const char* lpName);
DWORD WaitForSingleObject(HANDLE hHandle, DWORD dwMilliseconds);
BOOL ReleaseMutex(HANDLE hMutex);
// Not Win32: how many times the calling thread holds the mutex now (0: it
// doesn't own it, or the handle names no mutex).
DWORD MutexHoldCount(HANDLE hMutex);
BOOL CloseHandle(HANDLE hObject);

void Sleep(DWORD dwMilliseconds);
// Sleeps; if bAlertable, completion routines of this thread run inside and
// end the sleep early with WAIT_IO_COMPLETION (192).
DWORD SleepEx(DWORD dwMilliseconds, BOOL bAlertable);

using AFX_THREADPROC = unsigned int (*)(void* pParam);
CWinThread* AfxBeginThread(AFX_THREADPROC pfnThreadProc, void* pParam, int nPriority = 0,
                           UINT nStackSize = 0, DWORD dwCreateFlags = 0,
                           SECURITY_ATTRIBUTES* lpSecurityAttrs = nullptr);

int rand();
void srand(unsigned int seed);
// The same sequence as srand(state) followed by rand(), on the caller's state.
int rand(unsigned int& state);

}  // namespace platform
