// Threads, sleeping and the runtime library's rand.
#include "internal.h"  // first: see the note there

#include <pthread.h>

#include <chrono>
#include <thread>

namespace platform {

// A started thread. It frees itself when its body returns (MFC's auto-delete);
// nobody joins it.
class CWinThread {
 public:
  AFX_THREADPROC proc;
  void* param;
};

namespace {

void* threadMain(void* arg) {
  CWinThread* thread = static_cast<CWinThread*>(arg);
  AFX_THREADPROC proc = thread->proc;
  void* param = thread->param;
  delete thread;
  proc(param);
  return nullptr;
}

thread_local std::uint32_t t_randState = 1;

}  // namespace

CWinThread* AfxBeginThread(AFX_THREADPROC pfnThreadProc, void* pParam, int, UINT nStackSize, DWORD,
                           SECURITY_ATTRIBUTES*) {
  int result = 0;
  if (fault::check(fault::Call::AfxBeginThread, result)) {
    detail::fail(result);
    return nullptr;
  }
  if (pfnThreadProc == nullptr) return nullptr;
  CWinThread* thread = new CWinThread{pfnThreadProc, pParam};
  pthread_attr_t attributes;
  pthread_attr_init(&attributes);
  pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
  if (nStackSize != 0) pthread_attr_setstacksize(&attributes, nStackSize);
  pthread_t id;
  int rc = pthread_create(&id, &attributes, threadMain, thread);
  pthread_attr_destroy(&attributes);
  if (rc != 0) {
    delete thread;
    detail::fail(WSAENOBUFS);
    return nullptr;
  }
  // The pointer names a thread that may already have ended; like MFC's it is
  // only a token for the caller, never to be dereferenced after the thread ends.
  return thread;
}

void Sleep(DWORD dwMilliseconds) {
  std::this_thread::sleep_for(std::chrono::milliseconds(dwMilliseconds));
}

DWORD SleepEx(DWORD dwMilliseconds, BOOL bAlertable) {
  if (!bAlertable) {
    Sleep(dwMilliseconds);
    return 0;
  }
  DWORD index = 0;
  DWORD result = detail::waitForEvents(0, nullptr, dwMilliseconds, true, index);
  return result == WSA_WAIT_IO_COMPLETION ? WSA_WAIT_IO_COMPLETION : 0;
}

// The Microsoft runtime's generator: same sequence for the same seed.
int rand() {
  t_randState = t_randState * 214013u + 2531011u;
  return static_cast<int>((t_randState >> 16) & 0x7FFF);
}

void srand(unsigned int seed) { t_randState = seed; }

int rand(unsigned int& state) {
  state = state * 214013u + 2531011u;
  return static_cast<int>((state >> 16) & 0x7FFF);
}

}  // namespace platform
