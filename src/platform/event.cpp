// Manual-reset event objects. The wait set of each thread that waits on an
// event is among its waiters; setting the event tells them.
#include "internal.h"  // first: see the note there

namespace platform {
namespace detail {
namespace {

HandleTable<EventObject>& eventTable() {
  static auto* table = new HandleTable<EventObject>(HandleKind::Event);
  return *table;
}

}  // namespace

std::mutex& eventLock() {
  static auto* lock = new std::mutex;
  return *lock;
}

std::shared_ptr<EventObject> findEvent(WSAEVENT handle) {
  return eventTable().find(handleValue(handle));
}

void signalLocked(EventObject& event) {
  if (event.signalled) return;
  event.signalled = true;
  for (WaitEntry* waiter = event.waiters; waiter != nullptr; waiter = waiter->nextWaiter)
    waiter->set->noteSignalled(*waiter);
}

}  // namespace detail

WSAEVENT WSACreateEvent() {
  int result = 0;
  if (fault::check(fault::Call::WSACreateEvent, result)) {
    detail::fail(result);
    return WSA_INVALID_EVENT;
  }
  return detail::toHandle(detail::eventTable().insert(std::make_shared<detail::EventObject>()));
}

BOOL WSACloseEvent(WSAEVENT hEvent) {
  std::shared_ptr<detail::EventObject> event = detail::eventTable().remove(detail::handleValue(hEvent));
  if (!event) {
    detail::fail(WSA_INVALID_HANDLE);
    return 0;
  }
  // A wait that still holds the object keeps it alive; it just never fires,
  // and the next wait of that thread resolves its handles anew.
  std::lock_guard<std::mutex> hold(detail::eventLock());
  event->socket.reset();
  detail::relinkLocked(*event);
  for (detail::WaitEntry* waiter = event->waiters; waiter != nullptr; waiter = waiter->nextWaiter)
    waiter->set->noteClosed();
  return 1;
}

BOOL WSASetEvent(WSAEVENT hEvent) {
  std::shared_ptr<detail::EventObject> event = detail::findEvent(hEvent);
  if (!event) {
    detail::fail(WSA_INVALID_HANDLE);
    return 0;
  }
  std::lock_guard<std::mutex> hold(detail::eventLock());
  detail::signalLocked(*event);
  return 1;
}

BOOL WSAResetEvent(WSAEVENT hEvent) {
  std::shared_ptr<detail::EventObject> event = detail::findEvent(hEvent);
  if (!event) {
    detail::fail(WSA_INVALID_HANDLE);
    return 0;
  }
  std::lock_guard<std::mutex> hold(detail::eventLock());
  event->signalled = false;
  return 1;
}

}  // namespace platform
