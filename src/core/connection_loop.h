#ifndef BTBUS_SRC_CORE_CONNECTION_LOOP_H
#define BTBUS_SRC_CORE_CONNECTION_LOOP_H

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <vector>

#include <dbus/dbus.h>

namespace Bluetooth {

class RemoteObject;

namespace internal {

// The one loop of a bus connection: who reads the socket and dispatches, the
// work that dispatching hands over (signals, the Agent's requests), the
// receiving threads that run it, and the waits for replies beside them.
//
// Dispatching never runs callers' code: signals and deferred method calls are
// queued and run by a receiving thread (or, for method calls, by a thread
// waiting in a pending call), outside libdbus's dispatch lock. So whoever reads
// the socket is never held up. A thread waiting for a reply reads the socket
// itself at first and takes its reply off the queue, so that a quick reply
// wakes one thread; what else it reads it leaves to a receiving thread to
// dispatch, unless every receiving thread is busy in a handler.
class ConnectionLoop {
public:
    // The loop of connection, made on first use and kept as long as the
    // process (shared connections live that long).
    static ConnectionLoop* of(DBusConnection* connection);

    enum End { kReplied, kTimedOut, kInterrupted, kClosed, kNotSent };
    // A thread waiting for the reply to its call.
    struct Waiter;

    // Sends message and waits for its reply, at most timeout (libdbus's
    // meaning), or until *interrupted is set. On kReplied, *reply is the reply,
    // owned by the caller; a reply that comes later is dropped. kNotSent: the
    // connection was closed; kClosed: it closed during the wait.
    // runMethodCalls: answer deferred method calls (the Agent's) meanwhile on
    // this thread.
    End send(DBusMessage* message, int timeout, bool runMethodCalls, const std::atomic<int>* interrupted,
             DBusMessage** reply);
    // A blocking call: the reply, or null with error set as libdbus words a
    // D-Bus error, a time-out or a closed connection. Inside a dispatch it waits
    // as libdbus does, dispatching nothing.
    DBusMessage* call(DBusMessage* message, int timeout, DBusError* error);

    // Why this thread cannot wait for a pending call now (it is inside
    // libdbus's dispatch: the library's, or the program's own loop's), or null.
    const char* cannotWait() const;

    // A method call for a thread that may run callers' code; the Agent's
    // object path dispatches through this. It is queued for a receiving thread
    // or a thread waiting in a pending call; with neither (the application
    // dispatches the connection itself) it runs here, and its result is
    // returned to libdbus.
    DBusHandlerResult defer(DBusMessage* message, DBusObjectPathMessageFunction function,
                            void* data);

    // A receiving thread: announce it before the thread starts (owner is then
    // the dispatching object), run it on the thread.
    void addReceiver(RemoteObject* owner);
    void removeReceiver(RemoteObject* owner);  // its thread could not start
    struct Receiver;
    void receive(Receiver* me);

    // Work waiting for a thread to run it.
    size_t queued();

    // Every loop: the stop that ends receiving threads and drops later signals.
    static void stopAll();
    static bool stopped();
    // owner is being destroyed: no loop dispatches with it any more.
    static void forgetOwner(RemoteObject* owner);
    // data is going away: its queued method calls are dropped, and a running
    // one on another thread is waited for.
    static void forgetMethodCalls(void* data);

private:
    struct Work {
        DBusMessage* message;                    // one reference owned
        DBusObjectPathMessageFunction function;  // null: a signal
        void* data;
    };
    typedef std::chrono::steady_clock Clock;

    explicit ConnectionLoop(DBusConnection* connection);

    // Reads what the socket holds (waiting up to milliseconds, -1 without end)
    // and, if dispatch, dispatches it; runs with pumping_ set by the caller.
    // Without dispatch, returns the reply to serial when it heads the incoming
    // queue. fresh: the first read for a call just sent.
    DBusMessage* pump(int milliseconds, dbus_uint32_t serial, bool dispatch, bool fresh);
    // Waits up to milliseconds for the socket and reads what it holds; true
    // when messages are queued then.
    bool readSocket(int milliseconds);
    // Takes the reply to serial off the incoming queue if it comes first.
    DBusMessage* takeReply(dbus_uint32_t serial);
    void dispatchAll();
    void runWork(Work& work);
    // Pops the first work item that may run on this thread; false if none.
    bool takeWork(bool methodCallsOnly, Work& work);
    void queueSignal(DBusMessage* message);
    void queueLocked(const Work& work);
    // Whether a thread of ours will run queued method calls.
    bool handsOverLocked() const;
    // Runs the method calls queued for threads that are gone.
    void runLeftMethodCalls(std::unique_lock<std::mutex>& hold);
    void wake();
    bool mayPump(bool receiving, Clock::time_point now) const;
    bool mayDispatch(bool receiving, Clock::time_point now) const;
    End waitFor(Waiter* waiter, int timeout, bool runMethodCalls, const std::atomic<int>* interrupted);
    // Gives a reply that a thread waits for to that thread; false if none does.
    bool handOver(DBusMessage* reply);
    Waiter* waiterLocked(dbus_uint32_t serial) const;

    static DBusHandlerResult filter(DBusConnection*, DBusMessage* message, void* data);
    static void onDispatchStatus(DBusConnection*, DBusDispatchStatus status, void* data);

    DBusConnection* const connection_;
    int wake_[2];  // wakes the thread that polls the socket

    std::mutex lock_;  // guards what follows
    std::condition_variable changed_;  // a reply arrived, work queued, the pump freed, a stop
    bool pumping_;                     // a thread reads the connection
    bool receiverPumping_;             // ... and it is a receiving thread
    const Waiter* readerWaiter_;       // ... or it waits for this reply
    std::vector<Waiter*> waiters_;     // threads waiting for replies
    int sending_;                      // threads between sending a call and waiting
    std::vector<DBusMessage*> unclaimed_;  // replies dispatched meanwhile
    Clock::time_point pumpFreeSince_;
    // Threads that began waiting for a reply beside a receiving thread a moment
    // ago read the socket themselves, so that a quick reply wakes one thread,
    // not two; receiving threads leave the socket to them until handBackAt_.
    int youngCallers_;
    Clock::time_point handBackAt_;
    bool dispatchWanted_;              // a waiting thread read what a receiving thread dispatches
    bool runningWork_;                 // a receiving thread runs work
    Clock::time_point workSince_;
    std::deque<Work> work_;
    int receivers_;
    int methodRunners_;  // threads waiting in a pending call, which run method calls
    bool overflowLogged_;
};

// What a call that got no reply in time reads, as libdbus words it.
extern const char kNoReplyText[];

// Marks what a callback uses (an object, an Agent), so that its destruction on
// another thread waits for the callback to return. A thread never waits for
// its own uses: a handler may destroy its own proxy.
void beginUse(const void* key);
void endUse(const void* key);
void waitUnused(const void* key);

}  // namespace internal
}  // namespace Bluetooth

#endif
