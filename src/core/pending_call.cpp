#include <bluetooth/remote_object.h>

#include <atomic>
#include <csignal>

#include "core/connection_loop.h"
#include "core/dbus_holders.h"
#include "core/loop_flags.h"

namespace Bluetooth {

namespace {

// Lock-free, so that the SIGINT/SIGTERM handler may write it.
std::atomic<int> gInterrupted(0);
std::atomic<int> gReplyArrived(0);
static_assert(ATOMIC_INT_LOCK_FREE == 2, "the interrupt flag must be lock-free");

void onInterrupt(int) { gInterrupted = 1; }

void installInterruptHandlers() {
    struct sigaction action;
    action.sa_handler = &onInterrupt;
    sigemptyset(&action.sa_mask);
    action.sa_flags = SA_NOCLDSTOP;
    sigaction(SIGTERM, &action, 0);
    sigaction(SIGINT, &action, 0);
}

}  // namespace

int RemoteObject::sendMessagePending() {
    internal::ScopedError error;
    releaseReply();
    int result = 0;
    if (const char* why = cannotSend()) {
        result = fail(11, why);
    } else if (const char* inDispatch = internal::ConnectionLoop::of(connection)->cannotWait()) {
        result = fail(11, inDispatch);
    } else {
        installInterruptHandlers();
        // Any thread may wait here, a handler on a receiving thread included:
        // the Agent's requests are answered meanwhile on this thread.
        DBusMessage* answer = 0;
        internal::ConnectionLoop::End end =
            internal::ConnectionLoop::of(connection)->send(message, -1, true, &gInterrupted, &answer);
        if (end == internal::ConnectionLoop::kReplied) {
            gReplyArrived = 1;
            setReplyMessage(answer);  // none gives error 2
        } else if (end == internal::ConnectionLoop::kNotSent) {
            result = fail(11, error.text());  // libdbus gives no reason
        } else if (end == internal::ConnectionLoop::kTimedOut) {
            // A time-out reads as the error reply libdbus would have made; an
            // interrupt leaves no reply (error 2 when it is read).
            setReplyMessage(dbus_message_new_error(message, DBUS_ERROR_NO_REPLY, internal::kNoReplyText));
        }
    }
    releaseMessage();
    gInterrupted = 0;
    gReplyArrived = 0;
    return result;
}

namespace internal {

bool interruptedFlag() { return gInterrupted.load() != 0; }
bool replyArrivedFlag() { return gReplyArrived.load() != 0; }

}  // namespace internal

}  // namespace Bluetooth
