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
// Never freed: shared connections live as long.
std::vector<ConnectionLoop*>& gLoops = *new std::vector<ConnectionLoop*>;

// The loop whose receiving thread this thread is; null on other threads.
thread_local ConnectionLoop* tReceiving = 0;
// The loop whose connection this thread dispatches for the library (an object
// path of other code than the Agent's is called there).
thread_local const ConnectionLoop* tDispatching = 0;
// The loop whose socket this thread reads at the moment.
thread_local const ConnectionLoop* tPumping = 0;

const char kInDispatchText[] =
    "A pending call cannot be waited for inside libdbus's dispatch (a handler of the connection's own)";

// The messages that the program's own loop (not a thread of the library)
// dispatches on this thread and that are still alive: while any is, the
// thread may be inside that dispatch, whose lock a wait must not take. Counted
// down by libdbus when it frees a message, possibly on another thread and
// after this one ended: kept as long as the process, one per such thread and
// connection.
struct ForeignDispatch {
    const ConnectionLoop* loop;
    std::atomic<int> alive;
};
std::mutex gForeignLock;
std::vector<ForeignDispatch*>& gForeignDispatches = *new std::vector<ForeignDispatch*>;
thread_local std::vector<ForeignDispatch*> tForeignDispatches;

dbus_int32_t foreignSlot() {
    static const dbus_int32_t slot = [] {
        dbus_int32_t allocated = -1;
        dbus_message_allocate_data_slot(&allocated);
        return allocated;
    }();
    return slot;
}

ForeignDispatch* foreignDispatch(const ConnectionLoop* loop, bool make) {
    for (size_t i = 0; i < tForeignDispatches.size(); ++i)
        if (tForeignDispatches[i]->loop == loop) return tForeignDispatches[i];
    if (!make) return 0;
    ForeignDispatch* made = new ForeignDispatch;
    made->loop = loop;
    made->alive = 0;
    {
        std::lock_guard<std::mutex> hold(gForeignLock);
        gForeignDispatches.push_back(made);
    }
    tForeignDispatches.push_back(made);
    return made;
}

void foreignMessageFreed(void* data) { --static_cast<ForeignDispatch*>(data)->alive; }

void noteForeignDispatch(const ConnectionLoop* loop, DBusMessage* message) {
    ForeignDispatch* foreign = foreignDispatch(loop, true);
    ++foreign->alive;
    if (!dbus_message_set_data(message, foreignSlot(), foreign, &foreignMessageFreed)) --foreign->alive;
}

bool insideDispatch(const ConnectionLoop* loop) {
    if (tDispatching == loop) return true;
    ForeignDispatch* foreign = foreignDispatch(loop, false);
    return foreign != 0 && foreign->alive.load() > 0;
}

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

}  // namespace

// A receiving thread: its loop, and the object it was started on (null once
// that is destroyed).
struct ConnectionLoop::Receiver {
    ConnectionLoop* loop;
    RemoteObject* object;
};

namespace {

// Every receiving thread, and those announced but not yet started (keyed by
// the object, never dereferenced).
std::set<ConnectionLoop::Receiver*> gReceivers;
std::multimap<const void*, ConnectionLoop::Receiver*> gStarting;
thread_local ConnectionLoop::Receiver* tReceiver = 0;

}  // namespace

// A thread waiting for the reply to its call. Whoever reads or dispatches the
// reply hands it over here, under the loop's lock.
struct ConnectionLoop::Waiter {
    dbus_uint32_t serial;
    DBusMessage* reply;  // one reference owned; null until it came
};

namespace {

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
      sending_(0),
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

// For a receiving thread; a signal that the program's own loop dispatches
// while none runs is the program's.
void ConnectionLoop::queueSignal(DBusMessage* message) {
    std::lock_guard<std::mutex> hold(lock_);
    if (stopped() || (receivers_ == 0 && tDispatching != this)) return;
    Work work = { dbus_message_ref(message), 0, 0 };
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

// Every signal is left unhandled, so that other filters still see it. A
// reply that libdbus has no pending call for may be one a thread of ours waits
// for.
DBusHandlerResult ConnectionLoop::filter(DBusConnection*, DBusMessage* message, void* data) {
    ConnectionLoop* loop = static_cast<ConnectionLoop*>(data);
    if (tDispatching != loop) noteForeignDispatch(loop, message);
    int type = dbus_message_get_type(message);
    if (type == DBUS_MESSAGE_TYPE_SIGNAL) {
        loop->queueSignal(message);
    } else if (type == DBUS_MESSAGE_TYPE_METHOD_RETURN || type == DBUS_MESSAGE_TYPE_ERROR) {
        if (loop->handOver(message)) return DBUS_HANDLER_RESULT_HANDLED;
    }
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
}

ConnectionLoop::Waiter* ConnectionLoop::waiterLocked(dbus_uint32_t serial) const {
    for (size_t i = 0; i < waiters_.size(); ++i)
        if (waiters_[i]->serial == serial) return waiters_[i];
    return 0;
}

bool ConnectionLoop::handOver(DBusMessage* reply) {
    dbus_uint32_t serial = dbus_message_get_reply_serial(reply);
    bool polling;
    {
        std::lock_guard<std::mutex> hold(lock_);
        Waiter* waiter = waiterLocked(serial);
        if (waiter == 0 || waiter->reply != 0) {
            // Its caller may have sent it and not yet said that it waits.
            if (sending_ > 0) unclaimed_.push_back(dbus_message_ref(reply));
            return false;
        }
        waiter->reply = dbus_message_ref(reply);
        polling = readerWaiter_ == waiter && tPumping != this;
    }
    changed_.notify_all();
    if (polling) wake();  // the waiting thread polls the socket
    return true;
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
    const ConnectionLoop* outer = tDispatching;
    tDispatching = this;
    while (dbus_connection_dispatch(connection_) == DBUS_DISPATCH_DATA_REMAINS) {
    }
    tDispatching = outer;
}

const char* ConnectionLoop::cannotWait() const { return insideDispatch(this) ? kInDispatchText : 0; }

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
        // pipe. Dispatching hands a reply to the thread waiting for it.
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
            if (tReceiver != 0) owner = tReceiver->object;
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
        Receiver* receiver = new Receiver;
        receiver->loop = this;
        receiver->object = owner;
        gReceivers.insert(receiver);
        gStarting.insert(std::make_pair(static_cast<const void*>(owner), receiver));
    }
    std::lock_guard<std::mutex> hold(lock_);
    ++receivers_;
}

void ConnectionLoop::removeReceiver(RemoteObject* owner) {
    {
        std::lock_guard<std::mutex> hold(gUseLock);
        std::multimap<const void*, Receiver*>::iterator found = gStarting.find(owner);
        if (found != gStarting.end()) {
            gReceivers.erase(found->second);
            delete found->second;
            gStarting.erase(found);
        }
    }
    std::unique_lock<std::mutex> hold(lock_);
    --receivers_;
    runLeftMethodCalls(hold);
}

void ConnectionLoop::receive(Receiver* me) {
    tReceiving = this;
    tReceiver = me;
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
    std::lock_guard<std::mutex> held(gUseLock);
    gReceivers.erase(me);
    delete me;
    tReceiver = 0;
}

ConnectionLoop::End ConnectionLoop::waitFor(Waiter* waiter, int timeout, bool runMethodCalls,
                                            const std::atomic<int>* interrupted) {
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
        if (waiter->reply != 0) {
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
            DBusMessage* mine = pump(slice, waiter->serial, !young, fresh);
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
                waiter->reply = mine;
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
    waiters_.erase(std::find(waiters_.begin(), waiters_.end(), waiter));
    if (waiter->reply != 0) end = kReplied;  // it came as the wait ended
    if (runMethodCalls) {
        --methodRunners_;
        runLeftMethodCalls(hold);
    }
    return end;
}

ConnectionLoop::End ConnectionLoop::send(DBusMessage* message, int timeout, bool runMethodCalls,
                                         const std::atomic<int>* interrupted, DBusMessage** reply) {
    *reply = 0;
    // A closed connection would take the message and drop it.
    if (!dbus_connection_get_is_connected(connection_)) return kNotSent;
    Waiter waiter = { 0, 0 };
    {
        std::lock_guard<std::mutex> hold(lock_);
        ++sending_;
    }
    bool sent = dbus_connection_send(connection_, message, &waiter.serial) != 0;
    {
        std::lock_guard<std::mutex> hold(lock_);
        if (sent) waiters_.push_back(&waiter);
        // Replies dispatched while their callers were between sending and
        // waiting.
        for (size_t i = 0; i < unclaimed_.size(); ++i) {
            if (sent && waiter.reply == 0 && dbus_message_get_reply_serial(unclaimed_[i]) == waiter.serial) {
                waiter.reply = unclaimed_[i];
                unclaimed_.erase(unclaimed_.begin() + static_cast<std::ptrdiff_t>(i));
                break;
            }
        }
        if (--sending_ == 0) {
            for (size_t i = 0; i < unclaimed_.size(); ++i) dbus_message_unref(unclaimed_[i]);
            unclaimed_.clear();
        }
    }
    if (!sent) return kNotSent;
    // Sending wrote what it could; what is left is written by the wait's reads.
    if (dbus_connection_has_messages_to_send(connection_)) dbus_connection_flush(connection_);
    End end = waitFor(&waiter, timeout, runMethodCalls, interrupted);
    *reply = waiter.reply;
    return end;
}

DBusMessage* ConnectionLoop::call(DBusMessage* message, int timeout, DBusError* error) {
    // Dispatching, or taking a reply off the queue, would wait for the
    // dispatch this thread is in: libdbus's own wait reads the reply alone.
    if (insideDispatch(this)) return dbus_connection_send_with_reply_and_block(connection_, message, timeout, error);
    DBusMessage* reply = 0;
    End end = send(message, timeout, false, 0, &reply);
    if (end == kClosed || end == kNotSent)
        dbus_set_error_const(error, DBUS_ERROR_DISCONNECTED, "Connection is closed");
    else if (end != kReplied)
        dbus_set_error_const(error, DBUS_ERROR_NO_REPLY, kNoReplyText);
    if (reply != 0 && dbus_set_error_from_message(error, reply)) {
        dbus_message_unref(reply);
        reply = 0;
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
    for (std::set<Receiver*>::iterator it = gReceivers.begin(); it != gReceivers.end(); ++it)
        if ((*it)->object == owner) (*it)->object = 0;
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
    internal::ConnectionLoop::Receiver* receiver = 0;
    {
        std::lock_guard<std::mutex> hold(internal::gUseLock);
        std::multimap<const void*, internal::ConnectionLoop::Receiver*>::iterator found =
            internal::gStarting.find(object);
        if (found != internal::gStarting.end()) {
            receiver = found->second;
            internal::gStarting.erase(found);
        }
    }
    if (receiver != 0) receiver->loop->receive(receiver);
    return 0;
}

}  // namespace Bluetooth
