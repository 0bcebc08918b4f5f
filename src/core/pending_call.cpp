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
    DBusPendingCall* pending = 0;
    if (const char* why = cannotSend()) {
        result = fail(11, why);
    } else if (const char* inDispatch = internal::ConnectionLoop::cannotWait()) {
        result = fail(11, inDispatch);
    } else if (!dbus_connection_send_with_reply(connection, message, &pending, -1) || pending == 0) {
        result = fail(11, error.text());  // libdbus sets no error text here
    } else {
        dbus_connection_flush(connection);
        installInterruptHandlers();
        // Any thread may wait here, a handler on a receiving thread included:
        // the Agent's requests are answered meanwhile on this thread.
        DBusMessage* answer = 0;
        internal::ConnectionLoop::End end = internal::ConnectionLoop::of(connection)->wait(
            pending, dbus_message_get_serial(message), -1, true, &gInterrupted, &answer);
        if (end == internal::ConnectionLoop::kReplied) {
            gReplyArrived = 1;
            setReplyMessage(answer);  // none gives error 2
        } else {
            dbus_pending_call_cancel(pending);  // no reply can arrive for it later
            // A time-out reads as the error reply libdbus would have made; an
            // interrupt leaves no reply (error 2 when it is read).
            if (end == internal::ConnectionLoop::kTimedOut)
                setReplyMessage(dbus_message_new_error(message, DBUS_ERROR_NO_REPLY, internal::kNoReplyText));
        }
        dbus_pending_call_unref(pending);
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
