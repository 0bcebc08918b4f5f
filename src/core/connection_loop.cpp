#include "core/connection_loop.h"

#include <algorithm>
#include <cerrno>
#include <map>
#include <set>
#include <vector>

#include <fcntl.h>
#include <poll.h>
#include <pthread.h>
#include <unistd.h>

#include <bluetooth/remote_object.h>

#include "core/dbus_holders.h"
#include "core/log.h"
#include "core/owner_watch.h"

BT_LOG_FILE("connection_loop.cpp");

namespace Bluetooth {
namespace internal {

namespace {

// libdbus's own default for a time-out of -1.
const int kDefaultTimeoutMs = 25000;
// How long the pump may stay free, every receiving thread busy in a handler,
// before a waiting thread reads the socket and dispatches itself.
const int kTakeOverMs = 20;
// How long a thread waiting for a reply beside a receiving thread reads the
// socket itself (most replies come sooner)...
const int kYoungMs = 5;
// ... and how long after such a read receiving threads leave the socket to the
// next call, at most the delay it adds to a signal.
const int kHandBackMs = 1;
// The longest a waiting thread reads the socket before it looks again whether
// its wait has ended (an interrupt, a receiving thread back from its handler).
const int kSliceMs = 50;
// How long a pump backs off when the socket is readable but another thread
// holds libdbus's I/O path (a flush), rather than spin on the socket.
const int kBackOffMs = 2;
// Queued signals with no receiving thread to run them: the oldest go first.
const size_t kMaxQueued = 100000;

}  // namespace

const char kNoReplyText[] =
    "Did not receive a reply. Possible causes include: the remote application did not send a "
    "reply, the message bus security policy blocked the reply, the reply timeout expired, or the "
    "network connection was broken.";

namespace {

std::atomic<int> gStop(0);

std::mutex gLoopsLock;
std::vector<ConnectionLoop*> gLoops;  // never freed: shared connections live as long

// The loop whose receiving thread this thread is; null on other threads.
thread_local ConnectionLoop* tReceiving = 0;
// Whether this thread is inside libdbus's dispatch (an object path of other
// code than the Agent's is called there): a wait there could never end.
thread_local bool tInDispatch = false;
// The loop whose socket this thread reads at the moment.
thread_local const ConnectionLoop* tPumping = 0;

const char kInDispatchText[] =
    "A reply cannot be waited for inside libdbus's dispatch (an object path's own handler)";

// ---- uses that destruction waits for ----

std::mutex gUseLock;
std::condition_variable gUseEnded;
std::multiset<const void*> gUses;
thread_local std::vector<const void*> tUses;

std::vector<const void*>& ownUses() { return tUses; }

void beginUseLocked(const void* key) {
    gUses.insert(key);
    ownUses().push_back(key);
}

// The dispatching object of each loop, and the loops announced but whose
// thread has not yet started (keyed by the object, never dereferenced).
std::map<ConnectionLoop*, RemoteObject*> gOwners;
std::multimap<const void*, ConnectionLoop*> gStarting;

// The notify of a waited-for pending call: the waiting thread takes the reply.
// The waiting thread and libdbus each hold a reference: the notify may run
// after the wait has ended (a wait also asks the call whether it completed).
}  // namespace

struct ConnectionLoop::Waiter {
    ConnectionLoop* loop;
    bool done;  // guarded by the loop's lock
    std::atomic<int> references;
};

namespace {

void releaseWaiter(void* data) {
    ConnectionLoop::Waiter* waiter = static_cast<ConnectionLoop::Waiter*>(data);
    if (--waiter->references == 0) delete waiter;
}

int pollFor(DBusConnection* connection, int wakeFd, int milliseconds, bool& socketReady) {
    struct pollfd fds[2];
    int count = 0;
    if (wakeFd >= 0) {
        fds[count].fd = wakeFd;
        fds[count].events = POLLIN;
        fds[count].revents = 0;
        ++count;
    }
    int fd = -1;
    if (dbus_connection_get_unix_fd(connection, &fd)) {
        fds[count].fd = fd;
        fds[count].events = POLLIN;
        if (dbus_connection_has_messages_to_send(connection)) fds[count].events |= POLLOUT;
        fds[count].revents = 0;
        ++count;
    }
    socketReady = false;
    if (count == 0) {
        usleep(static_cast<useconds_t>(milliseconds < 0 ? 100000 : milliseconds * 1000));
        return 0;
    }
    int ready = poll(fds, count, milliseconds);
    if (ready <= 0) return ready;
    if (wakeFd >= 0 && fds[0].revents != 0) {
        char buffer[64];
        while (read(wakeFd, buffer, sizeof buffer) > 0) {
        }
    }
    socketReady = fd >= 0 && fds[count - 1].revents != 0;
    return ready;
}

}  // namespace

void beginUse(const void* key) {
    std::lock_guard<std::mutex> hold(gUseLock);
    beginUseLocked(key);
}

void endUse(const void* key) {
    std::lock_guard<std::mutex> hold(gUseLock);
    std::multiset<const void*>::iterator found = gUses.find(key);
    if (found != gUses.end()) gUses.erase(found);
    std::vector<const void*>& own = ownUses();
    std::vector<const void*>::reverse_iterator mine = std::find(own.rbegin(), own.rend(), key);
    if (mine != own.rend()) own.erase(std::next(mine).base());
    gUseEnded.notify_all();
}

void waitUnused(const void* key) {
    std::unique_lock<std::mutex> hold(gUseLock);
    size_t mine = static_cast<size_t>(std::count(ownUses().begin(), ownUses().end(), key));
    gUseEnded.wait(hold, [key, mine] { return gUses.count(key) <= mine; });
}

// ---- the loop of a connection ----

ConnectionLoop::ConnectionLoop(DBusConnection* connection)
    : connection_(connection),
      pumping_(false),
      receiverPumping_(false),
      readerWaiter_(0),
      pumpFreeSince_(Clock::now()),
      youngCallers_(0),
      handBackAt_(),
      dispatchWanted_(false),
      runningWork_(false),
      workSince_(),
      receivers_(0),
      methodRunners_(0),
      overflowLogged_(false) {
    if (pipe2(wake_, O_NONBLOCK | O_CLOEXEC) != 0) {
        BT_LOG_ERR("Failed to create wake-up pipe (%d)", errno);
        wake_[0] = wake_[1] = -1;
    }
    // libdbus would otherwise _exit() the process when the bus goes away.
    dbus_connection_set_exit_on_disconnect(connection, FALSE);
    dbus_connection_add_filter(connection, &filter, this, 0);
    // Messages can be queued by another thread's I/O (a flush reads what
    // arrives meanwhile): the thread polling the socket must look at them.
    dbus_connection_set_dispatch_status_function(connection, &onDispatchStatus, this, 0);
}

ConnectionLoop* ConnectionLoop::of(DBusConnection* connection) {
    std::lock_guard<std::mutex> hold(gLoopsLock);
    for (size_t i = 0; i < gLoops.size(); ++i)
        if (gLoops[i]->connection_ == connection) return gLoops[i];
    gLoops.push_back(new ConnectionLoop(connection));
    return gLoops.back();
}

void ConnectionLoop::wake() {
    if (wake_[1] < 0) return;
    char byte = 1;
    ssize_t written = write(wake_[1], &byte, 1);
    (void)written;  // a full pipe wakes the poll all the same
}

// The thread that reads the socket looks at the queue anyway when it is done.
void ConnectionLoop::onDispatchStatus(DBusConnection*, DBusDispatchStatus status, void* data) {
    ConnectionLoop* loop = static_cast<ConnectionLoop*>(data);
    if (status == DBUS_DISPATCH_DATA_REMAINS && tPumping != loop) loop->wake();
}

void ConnectionLoop::queue(const Work& work) {
    std::lock_guard<std::mutex> hold(lock_);
    queueLocked(work);
}

void ConnectionLoop::queueLocked(const Work& work) {
    if (work_.size() >= kMaxQueued) {
        // Nobody runs the queue (no receiving thread): keep the newest.
        std::deque<Work>::iterator oldest = work_.begin();
        while (oldest != work_.end() && oldest->function != 0) ++oldest;
        if (oldest != work_.end()) {
            dbus_message_unref(oldest->message);
            work_.erase(oldest);
        }
        if (!overflowLogged_) BT_LOG_ERR("Signal queue full: dropping the oldest signals");
        overflowLogged_ = true;
    }
    work_.push_back(work);
    changed_.notify_all();
}

// Every signal is left unhandled, so that other filters still see it.
DBusHandlerResult ConnectionLoop::filter(DBusConnection*, DBusMessage* message, void* data) {
    if (dbus_message_get_type(message) == DBUS_MESSAGE_TYPE_SIGNAL && !stopped()) {
        Work work = { dbus_message_ref(message), 0, 0 };
        static_cast<ConnectionLoop*>(data)->queue(work);
    }
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
}

bool ConnectionLoop::handsOverLocked() const { return (receivers_ > 0 && !stopped()) || methodRunners_ > 0; }

DBusHandlerResult ConnectionLoop::defer(DBusMessage* message, DBusObjectPathMessageFunction function,
                                        void* data) {
    {
        std::lock_guard<std::mutex> hold(lock_);
        if (handsOverLocked()) {
            Work work = { dbus_message_ref(message), function, data };
            queueLocked(work);
            return DBUS_HANDLER_RESULT_HANDLED;
        }
    }
    // No thread of ours will run it (the application dispatches the connection
    // itself): the dispatching thread does, and libdbus answers what it leaves.
    beginUse(data);
    DBusHandlerResult result = function(connection_, message, data);
    endUse(data);
    return result;
}

void ConnectionLoop::runLeftMethodCalls(std::unique_lock<std::mutex>& hold) {
    Work work;
    while (!handsOverLocked() && takeWork(true, work)) {
        beginUse(work.data);
        hold.unlock();
        runWork(work);
        hold.lock();
    }
}

void ConnectionLoop::dispatchAll() {
    tInDispatch = true;
    while (dbus_connection_dispatch(connection_) == DBUS_DISPATCH_DATA_REMAINS) {
    }
    tInDispatch = false;
}

const char* ConnectionLoop::cannotWait() { return tInDispatch ? kInDispatchText : 0; }

DBusMessage* ConnectionLoop::takeReply(dbus_uint32_t serial) {
    DBusMessage* head = dbus_connection_borrow_message(connection_);
    if (head == 0) return 0;
    int type = dbus_message_get_type(head);
    if ((type == DBUS_MESSAGE_TYPE_METHOD_RETURN || type == DBUS_MESSAGE_TYPE_ERROR) &&
        dbus_message_get_reply_serial(head) == serial) {
        dbus_connection_steal_borrowed_message(connection_, head);
        return head;
    }
    dbus_connection_return_message(connection_, head);
    return 0;
}

bool ConnectionLoop::readSocket(int milliseconds) {
    if (!dbus_connection_get_is_connected(connection_)) {
        // Nothing more will come: the wait is the caller's time-out.
        bool ignored;
        pollFor(connection_, wake_[0], milliseconds < 0 ? 100 : std::min(milliseconds, 100), ignored);
        return false;
    }
    bool socketReady = false;
    if (pollFor(connection_, wake_[0], milliseconds, socketReady) < 0 && errno != EINTR)
        usleep(kBackOffMs * 1000);
    if (!socketReady) return false;
    dbus_connection_read_write(connection_, 0);
    if (dbus_connection_get_dispatch_status(connection_) == DBUS_DISPATCH_DATA_REMAINS) return true;
    // The socket was ready, yet nothing came of it: another thread holds
    // libdbus's I/O path (a flush) and will read it.
    usleep(kBackOffMs * 1000);
    return false;
}

DBusMessage* ConnectionLoop::pump(int milliseconds, dbus_uint32_t serial, bool dispatch, bool fresh) {
    tPumping = this;
    DBusMessage* mine = 0;
    if (dispatch) {
        // What another thread's I/O queued is dispatched before anything is
        // read; right after a call was sent, that woke this thread through the
        // pipe. Dispatching completes the pending call of a reply, also the
        // failed ones of a closed connection, with the local Disconnected.
        if (fresh || dbus_connection_get_dispatch_status(connection_) != DBUS_DISPATCH_DATA_REMAINS)
            readSocket(milliseconds);
        dispatchAll();
    } else {
        // Leaves the rest to be dispatched by a receiving thread.
        if (!fresh) mine = takeReply(serial);
        if (mine == 0 && readSocket(milliseconds)) mine = takeReply(serial);
    }
    tPumping = 0;
    return mine;
}

bool ConnectionLoop::mayPump(bool receiving, Clock::time_point now) const {
    if (pumping_) return false;
    if (receiving || receivers_ == 0 || stopped()) return true;
    // A receiving thread reads the socket as soon as it is free of handlers.
    return now - pumpFreeSince_ >= std::chrono::milliseconds(kTakeOverMs);
}

bool ConnectionLoop::mayDispatch(bool receiving, Clock::time_point now) const {
    if (receiving || receivers_ == 0 || stopped()) return true;
    // Every receiving thread is busy in a handler.
    return runningWork_ && receivers_ == 1 && now - workSince_ >= std::chrono::milliseconds(kTakeOverMs);
}

bool ConnectionLoop::takeWork(bool methodCallsOnly, Work& work) {
    for (std::deque<Work>::iterator it = work_.begin(); it != work_.end(); ++it) {
        if (methodCallsOnly && it->function == 0) continue;
        work = *it;
        work_.erase(it);
        return true;
    }
    return false;
}

void ConnectionLoop::runWork(Work& work) {
    if (work.function == 0) {
        RemoteObject* owner = 0;
        {
            std::lock_guard<std::mutex> hold(gUseLock);
            std::map<ConnectionLoop*, RemoteObject*>::iterator found = gOwners.find(this);
            if (found != gOwners.end()) owner = found->second;
            if (owner != 0) beginUseLocked(owner);
        }
        if (!stopped()) {
            dispatchOwnerChange(work.message);
            RemoteObject::signalHandlerDispatcherObjectPath(owner, work.message);
            RemoteObject::signalHandlerDispatcherStringVariant(owner, work.message);
            RemoteObject::signalHandlerDispatcherString(owner, work.message);
            RemoteObject::signalHandlerDispatcherStringDict(owner, work.message);
            RemoteObject::signalHandlerDispatcherNoArgument(owner, work.message);
        }
        if (owner != 0) endUse(owner);
    } else {
        DBusHandlerResult result = work.function(connection_, work.message, work.data);
        endUse(work.data);
        // What libdbus answers a method call that nobody handled.
        if (result == DBUS_HANDLER_RESULT_NOT_YET_HANDLED &&
            dbus_message_get_type(work.message) == DBUS_MESSAGE_TYPE_METHOD_CALL &&
            !dbus_message_get_no_reply(work.message)) {
            MessagePtr error(dbus_message_new_error_printf(
                work.message, DBUS_ERROR_UNKNOWN_METHOD,
                "Method \"%s\" with signature \"%s\" on interface \"%s\" doesn't exist\n",
                dbus_message_get_member(work.message), dbus_message_get_signature(work.message),
                dbus_message_get_interface(work.message) ? dbus_message_get_interface(work.message)
                                                          : "(null)"));
            if (error) {
                dbus_connection_send(connection_, error.get(), 0);
                dbus_connection_flush(connection_);
            }
        }
    }
    dbus_message_unref(work.message);
}

void ConnectionLoop::addReceiver(RemoteObject* owner) {
    {
        std::lock_guard<std::mutex> hold(gUseLock);
        gOwners[this] = owner;
        gStarting.insert(std::make_pair(static_cast<const void*>(owner), this));
    }
    std::lock_guard<std::mutex> hold(lock_);
    ++receivers_;
}

void ConnectionLoop::removeReceiver(RemoteObject* owner) {
    {
        std::lock_guard<std::mutex> hold(gUseLock);
        std::multimap<const void*, ConnectionLoop*>::iterator found = gStarting.find(owner);
        if (found != gStarting.end()) gStarting.erase(found);
    }
    std::unique_lock<std::mutex> hold(lock_);
    --receivers_;
    runLeftMethodCalls(hold);
}

void ConnectionLoop::receive() {
    tReceiving = this;
    std::unique_lock<std::mutex> hold(lock_);
    while (!stopped()) {
        Work work;
        if (!runningWork_ && takeWork(false, work)) {
            runningWork_ = true;
            workSince_ = Clock::now();
            if (work.function != 0) beginUse(work.data);  // before the lock goes: see forgetMethodCalls
            hold.unlock();
            runWork(work);
            hold.lock();
            runningWork_ = false;
            changed_.notify_all();
            continue;
        }
        if (dispatchWanted_) {
            dispatchWanted_ = false;
            hold.unlock();
            dispatchAll();
            hold.lock();
            continue;
        }
        Clock::time_point now = Clock::now();
        bool callersRead = youngCallers_ > 0 || now < handBackAt_;
        if (!pumping_ && !callersRead) {
            pumping_ = receiverPumping_ = true;
            hold.unlock();
            pump(dbus_connection_get_is_connected(connection_) ? -1 : 100, 0, true, false);
            hold.lock();
            pumping_ = receiverPumping_ = false;
            pumpFreeSince_ = Clock::now();
            changed_.notify_all();
            continue;
        }
        if (callersRead)
            changed_.wait_until(hold, std::max(handBackAt_, now + std::chrono::milliseconds(kHandBackMs)));
        else
            changed_.wait(hold);
    }
    --receivers_;
    // Requests handed over to the receiving threads, when this was the last.
    runLeftMethodCalls(hold);
    changed_.notify_all();
    hold.unlock();
    tReceiving = 0;
}

void ConnectionLoop::onCompleted(DBusPendingCall*, void* data) {
    Waiter* waiter = static_cast<Waiter*>(data);
    ConnectionLoop* loop = waiter->loop;
    bool polling;
    {
        std::lock_guard<std::mutex> hold(loop->lock_);
        waiter->done = true;
        polling = loop->readerWaiter_ == waiter && tPumping != loop;
    }
    loop->changed_.notify_all();
    if (polling) loop->wake();  // the waiting thread polls the socket
    // Orders this call before the waiter's release for ThreadSanitizer, which
    // cannot see libdbus's own reference count.
    waiter->references.fetch_add(0, std::memory_order_release);
}

ConnectionLoop::End ConnectionLoop::wait(DBusPendingCall* pending, dbus_uint32_t serial, int timeout,
                                         bool runMethodCalls, const std::atomic<int>* interrupted,
                                         DBusMessage** reply) {
    Waiter* waiter = new Waiter;
    waiter->loop = this;
    waiter->done = false;
    waiter->references = 2;
    if (!dbus_pending_call_set_notify(pending, &onCompleted, waiter, &releaseWaiter))
        releaseWaiter(waiter);  // libdbus holds none
    DBusMessage* taken = 0;
    End end = waitFor(pending, waiter, serial, timeout, runMethodCalls, interrupted, &taken);
    releaseWaiter(waiter);
    *reply = 0;
    if (taken != 0) {
        dbus_pending_call_cancel(pending);  // its reply was taken off the queue
        *reply = taken;
    } else if (end == kReplied) {
        *reply = dbus_pending_call_steal_reply(pending);
    }
    return end;
}

ConnectionLoop::End ConnectionLoop::waitFor(DBusPendingCall* pending, Waiter* waiter, dbus_uint32_t serial,
                                            int timeout, bool runMethodCalls,
                                            const std::atomic<int>* interrupted, DBusMessage** taken) {
    using std::chrono::milliseconds;
    bool endless = timeout == DBUS_TIMEOUT_INFINITE;
    Clock::time_point start = Clock::now();
    Clock::time_point deadline = start + milliseconds(timeout < 0 ? kDefaultTimeoutMs : timeout);
    Clock::time_point youngUntil = start + milliseconds(kYoungMs);
    bool receiving = tReceiving == this;

    std::unique_lock<std::mutex> hold(lock_);
    // Beside a receiving thread, read the socket for the first moments of the
    // wait, leaving what is not this reply to be dispatched by that thread.
    bool young = !receiving && receivers_ > 0 && !stopped();
    if (young) ++youngCallers_;
    if (runMethodCalls) ++methodRunners_;
    bool askedForSocket = false;
    bool fresh = true;  // nothing read for this call yet
    End end;
    for (;;) {
        // Also asked of the call: it may have completed before the notify was set.
        if (waiter->done) {
            end = kReplied;
            break;
        }
        hold.unlock();
        bool completed = dbus_pending_call_get_completed(pending);
        hold.lock();
        if (completed) {
            end = kReplied;
            break;
        }
        if (!dbus_connection_get_is_connected(connection_)) {
            end = kClosed;
            break;
        }
        if (interrupted != 0 && interrupted->load() != 0) {
            end = kInterrupted;
            break;
        }
        Clock::time_point now = Clock::now();
        if (!endless && now >= deadline) {
            end = kTimedOut;
            break;
        }
        int left = endless ? kSliceMs
                           : static_cast<int>(std::chrono::duration_cast<milliseconds>(deadline - now).count()) + 1;
        if (young && (now >= youngUntil || receivers_ == 0 || stopped())) {
            // A slow reply: the receiving threads read it.
            young = false;
            --youngCallers_;
            handBackAt_ = now;
            changed_.notify_all();
        }
        Work work;
        if (runMethodCalls && takeWork(true, work)) {
            beginUse(work.data);
            hold.unlock();
            runWork(work);
            hold.lock();
            continue;
        }
        if (dispatchWanted_ && mayDispatch(receiving, now)) {
            dispatchWanted_ = false;
            hold.unlock();
            dispatchAll();
            hold.lock();
            continue;
        }
        if (!pumping_ && (young || mayPump(receiving, now))) {
            int slice = std::min(left, young ? static_cast<int>(std::chrono::duration_cast<milliseconds>(
                                                                    youngUntil - now).count()) + 1
                                             : kSliceMs);
            pumping_ = true;
            receiverPumping_ = receiving;
            readerWaiter_ = waiter;
            hold.unlock();
            DBusMessage* mine = pump(slice, serial, !young, fresh);
            fresh = false;
            bool remains = young && dbus_connection_get_dispatch_status(connection_) == DBUS_DISPATCH_DATA_REMAINS;
            hold.lock();
            pumping_ = receiverPumping_ = false;
            readerWaiter_ = 0;
            pumpFreeSince_ = Clock::now();
            if (young) handBackAt_ = pumpFreeSince_ + milliseconds(kHandBackMs);
            if (remains) dispatchWanted_ = true;
            // Others wait for the socket or for what was read; a quick call
            // alone wakes nobody.
            if (!young || remains || youngCallers_ > 1) changed_.notify_all();
            if (mine != 0) {
                *taken = mine;
                end = kReplied;
                break;
            }
            continue;
        }
        if (young && receiverPumping_ && !askedForSocket) {
            askedForSocket = true;  // the receiving thread leaves the socket when woken
            hold.unlock();
            wake();
            hold.lock();
            continue;
        }
        Clock::time_point until = now + milliseconds(std::min(left, kTakeOverMs));
        if (young) until = std::min(until, youngUntil);
        changed_.wait_until(hold, until);
    }
    if (young) --youngCallers_;
    if (runMethodCalls) {
        --methodRunners_;
        runLeftMethodCalls(hold);
    }
    return end;
}

DBusMessage* ConnectionLoop::call(DBusMessage* message, int timeout, DBusError* error) {
    if (const char* why = cannotWait()) {
        dbus_set_error_const(error, DBUS_ERROR_FAILED, why);
        return 0;
    }
    DBusPendingCall* pending = 0;
    if (!dbus_connection_send_with_reply(connection_, message, &pending, timeout) || pending == 0) {
        dbus_set_error_const(error, DBUS_ERROR_DISCONNECTED, "Connection is closed");
        return 0;
    }
    // Sending wrote what it could; what is left is written by the wait's reads.
    if (dbus_connection_has_messages_to_send(connection_)) dbus_connection_flush(connection_);
    DBusMessage* reply = 0;
    End end = wait(pending, dbus_message_get_serial(message), timeout, false, 0, &reply);
    if (end != kReplied) {
        dbus_pending_call_cancel(pending);  // a late reply is dropped
        if (end == kClosed)
            dbus_set_error_const(error, DBUS_ERROR_DISCONNECTED, "Connection is closed");
        else
            dbus_set_error_const(error, DBUS_ERROR_NO_REPLY, kNoReplyText);
    }
    dbus_pending_call_unref(pending);
    if (reply != 0 && dbus_set_error_from_message(error, reply)) {
        dbus_message_unref(reply);
        reply = 0;
    } else if (reply == 0 && !dbus_error_is_set(error)) {
        dbus_set_error_const(error, DBUS_ERROR_NO_REPLY, kNoReplyText);
    }
    return reply;
}

size_t ConnectionLoop::queued() {
    std::lock_guard<std::mutex> hold(lock_);
    return work_.size();
}

void ConnectionLoop::stopAll() {
    gStop = 1;
    std::lock_guard<std::mutex> hold(gLoopsLock);
    for (size_t i = 0; i < gLoops.size(); ++i) {
        ConnectionLoop* loop = gLoops[i];
        {
            std::lock_guard<std::mutex> held(loop->lock_);
            // Signals nobody will run any more.
            for (std::deque<Work>::iterator it = loop->work_.begin(); it != loop->work_.end();) {
                if (it->function != 0) {
                    ++it;
                    continue;
                }
                dbus_message_unref(it->message);
                it = loop->work_.erase(it);
            }
            loop->changed_.notify_all();
        }
        loop->wake();
    }
}

bool ConnectionLoop::stopped() { return gStop.load() != 0; }

void ConnectionLoop::forgetOwner(RemoteObject* owner) {
    std::lock_guard<std::mutex> hold(gUseLock);
    for (std::map<ConnectionLoop*, RemoteObject*>::iterator it = gOwners.begin(); it != gOwners.end();
         ++it)
        if (it->second == owner) it->second = 0;
}

void ConnectionLoop::forgetMethodCalls(void* data) {
    std::vector<ConnectionLoop*> loops;
    {
        std::lock_guard<std::mutex> hold(gLoopsLock);
        loops = gLoops;
    }
    for (size_t i = 0; i < loops.size(); ++i) {
        std::lock_guard<std::mutex> hold(loops[i]->lock_);
        std::deque<Work>& work = loops[i]->work_;
        for (std::deque<Work>::iterator it = work.begin(); it != work.end();) {
            if (it->function == 0 || it->data != data) {
                ++it;
                continue;
            }
            dbus_message_unref(it->message);
            it = work.erase(it);
        }
    }
    // Taken items are marked in use before the loop's lock is released.
    waitUnused(data);
}

}  // namespace internal

// The thread function of startLoop. The object is only a key here: it may be
// destroyed while its thread runs.
void* receiveSignal(void* object) {
    internal::ConnectionLoop* loop = 0;
    {
        std::lock_guard<std::mutex> hold(internal::gUseLock);
        std::multimap<const void*, internal::ConnectionLoop*>::iterator found =
            internal::gStarting.find(object);
        if (found != internal::gStarting.end()) {
            loop = found->second;
            internal::gStarting.erase(found);
        }
    }
    if (loop != 0) loop->receive();
    return 0;
}

}  // namespace Bluetooth
