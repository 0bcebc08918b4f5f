// The receiving thread beside calls, handlers and proxies of other threads, the
// error state it writes, the time-out of waits, and the stop.
#include <atomic>
#include <chrono>
#include <thread>

#include <gtest/gtest.h>

#include "core/call.h"
#include "core/connection_loop.h"
#include "integration/core/peer.h"
#include "support/log_capture.h"

using namespace Bluetooth;
using namespace btbus_test;
using Clock = std::chrono::steady_clock;

namespace {

long millisecondsSince(Clock::time_point start) {
    return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - start).count();
}

// Beyond the ~100 ms the loop promises, room for a loaded machine and sanitizers.
constexpr long kPromptMs = 250;

std::atomic<int> gCalls{ 0 };
void count(RemoteObject*, const char*) { ++gCalls; }

using TheReceivingThreadBesideCalls = PeerWithLoopTest;

TEST_F(TheReceivingThreadBesideCalls, LetsEveryBlockingCallHaveItsReplyWhileSignalsPourIn) {
    gCalls = 0;
    ASSERT_EQ(peer->setSignalHandlerString("Tick", &count), 0);
    callPeer(*peer, "StartTicking", 1u);
    for (int i = 0; i < 20000; ++i) {
        std::string word = "call " + std::to_string(i);
        ASSERT_NO_FATAL_FAILURE(buildCall(*peer, "Echo", word.c_str()));
        // A reply taken by the other thread shows as libdbus's 25 s time-out.
        ASSERT_EQ(peer->sendMessage(true, -1), 0) << "call " << i << ": " << peer->getErrorMessage();
        ASSERT_EQ(replyText(*peer), word);
    }
    callPeer(*peer, "StopTicking");
    const int emitted = std::stoi(replyText(*peer));
    EXPECT_GT(emitted, 100) << "the peer hardly ticked: the test proves little";
    EXPECT_TRUE(waitUntil([&] { return gCalls == emitted; }))
        << gCalls << " of " << emitted << " signals reached the handler";
}

std::atomic<long> gPendingMs{ -1 };
std::string gPendingAnswer;
void callFromHandler(RemoteObject*, const char*) {
    auto object = peerObject();
    buildCall(*object, "Echo", "from a handler");
    auto start = Clock::now();
    if (object->sendMessagePending() == 0) object->getReplyValue(gPendingAnswer);
    gPendingMs = millisecondsSince(start);
}

// Inside libdbus's dispatch a blocking call waits as libdbus does, and a
// pending call, which would have to dispatch, fails at once.
std::string callInsideDispatch() {
    RemoteObject bus("org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus", DBUS_BUS_SESSION);
    std::string id;
    bool answered = bus.newMessage("GetId") == 0 && bus.sendMessage(true, 3000) == 0 && bus.getReplyValue(id) == 0;
    bus.newMessage("GetId");
    auto start = Clock::now();
    bool refused = bus.sendMessagePending() == -1 && bus.getErrorNumber() == 11;
    return std::string(answered && id.size() == 32 ? "answered" : "not answered") +
           (refused && millisecondsSince(start) < kPromptMs ? ", refused at once" : ", not refused");
}

std::atomic<std::thread::id> gCallBackThread{};
std::string gInDispatch;
DBusHandlerResult answerCallBack(DBusConnection* connection, DBusMessage* call, void*) {
    gCallBackThread = std::this_thread::get_id();
    gInDispatch = callInsideDispatch();
    DBusMessage* reply = dbus_message_new_method_return(call);
    const char* text = "pong";
    dbus_message_append_args(reply, DBUS_TYPE_STRING, &text, DBUS_TYPE_INVALID);
    dbus_connection_send(connection, reply, nullptr);
    dbus_message_unref(reply);
    return DBUS_HANDLER_RESULT_HANDLED;
}

TEST_F(TheReceivingThreadBesideCalls, RunsCallBacksAndHandlersThatMayCallOutsideObjectPathsOnly) {
    // A signal handler's pending call gets its reply promptly.
    gPendingMs = -1;
    ASSERT_EQ(peer->setSignalHandlerString("StringSignal", &callFromHandler), 0);
    emit("StringSignal", "s", R"(["text"])");
    ASSERT_TRUE(waitUntil([] { return gPendingMs >= 0; }));
    EXPECT_EQ(gPendingAnswer, "from a handler");
    EXPECT_LT(gPendingMs.load(), kPromptMs);

    // The peer calls this process back before it answers: the waiting thread
    // leaves that call to the receiving thread.
    DBusObjectPathVTable vtable{};
    vtable.message_function = &answerCallBack;
    ASSERT_TRUE(dbus_connection_register_object_path(peer->getConnection(), "/org/btbus/CallBack", &vtable, nullptr));
    buildCall(*peer, "CallBack", peer->getConnectionName(), ObjectPath("/org/btbus/CallBack"));
    EXPECT_EQ(peer->sendMessage(true, 5000), 0) << peer->getErrorMessage();
    EXPECT_EQ(replyText(*peer), "called back: pong");
    EXPECT_NE(gCallBackThread.load(), std::this_thread::get_id());
    EXPECT_EQ(gInDispatch, "answered, refused at once");
    dbus_connection_unregister_object_path(peer->getConnection(), "/org/btbus/CallBack");
}

std::atomic<RemoteObject*> gSelf{ nullptr };
void deleteSelf(RemoteObject*, const char*) {
    ++gCalls;
    delete gSelf.exchange(nullptr);
}

TEST_F(TheReceivingThreadBesideCalls, LetsHandlersBeRegisteredAndDestroyedOnAnyThreadWhileSignalsPourIn) {
    gCalls = 0;
    callPeer(*peer, "StartTicking", 1u);
    std::thread churn([&] {
        for (int i = 0; i < 300; ++i) {
            auto object = peerObject();
            object->setSignalHandlerString("Tick", &count);
            object->setSignalHandlerString("Tick", &count);
            std::this_thread::sleep_for(1ms);
        }
    });
    // A handler that destroys its own proxy, which registered it twice: the
    // second registration is not called on the freed object.
    for (int i = 0; i < 20; ++i) {
        RemoteObject* self = peerObject().release();
        ASSERT_EQ(self->setSignalHandlerString("Tick", &deleteSelf), 0);
        ASSERT_EQ(self->setSignalHandlerString("Tick", &deleteSelf), 0);
        gSelf = self;  // from here on the handler may destroy it
        ASSERT_TRUE(waitUntil([] { return gSelf.load() == nullptr; }));
    }
    churn.join();
    callPeer(*peer, "StopTicking");
    EXPECT_GT(gCalls.load(), 20);
}

// A handler of the system bus's loop that makes a slow call on the session
// bus, for the first signal only: 1 while it waits, 2 once its call succeeded.
std::atomic<int> gCrossBus{ 0 };
void callSessionFromSystem(RemoteObject*, const char*) {
    int idle = 0;
    if (!gCrossBus.compare_exchange_strong(idle, 1)) return;
    auto object = peerObject();
    buildCall(*object, "Later", 1500u);
    gCrossBus = object->sendMessage(true, 5000) == 0 ? 2 : 3;
}

TEST_F(TheReceivingThreadBesideCalls, KeepsBlockingCallsPromptWhileAPendingCallAndAHandlerOfAnotherBusWait) {
    gCrossBus = 0;
    auto bus = std::make_unique<RemoteObject>("org.freedesktop.DBus", "/org/freedesktop/DBus",
                                              "org.freedesktop.DBus", DBUS_BUS_SYSTEM);
    ASSERT_EQ(bus->setSignalHandlerString("NameOwnerChanged", &callSessionFromSystem), 0);
    loopOwner(DBUS_BUS_SYSTEM);
    // A new name on the system bus makes the bus daemon signal it.
    DBusConnection* newcomer = dbus_bus_get_private(DBUS_BUS_SYSTEM, nullptr);
    ASSERT_NE(newcomer, nullptr);
    auto waiting = peerObject();
    std::thread pendingCall([&] {
        buildCall(*waiting, "Later", 1500u);
        EXPECT_EQ(waiting->sendMessagePending(), 0);
    });
    ASSERT_TRUE(waitUntil([] { return gCrossBus > 0; }));
    for (int i = 0; i < 10; ++i, std::this_thread::sleep_for(20ms)) {
        auto start = Clock::now();
        callPeer(*peer, "Echo", "x");
        EXPECT_LT(millisecondsSince(start), kPromptMs) << "call " << i;
    }
    bus.reset();  // while its handler most likely still waits: destruction waits for it to return
    EXPECT_EQ(gCrossBus.load(), 2);
    pendingCall.join();
    EXPECT_EQ(replyText(*waiting), "1500");
    dbus_connection_close(newcomer);
    dbus_connection_unref(newcomer);
}

std::atomic<bool> gNapping{ false };
void nap(RemoteObject*, const char*) {
    gNapping = true;
    std::this_thread::sleep_for(1500ms);
    gNapping = false;
}

// A reply slower than a caller's own first reads, while the only receiving
// thread sleeps in a handler: the waiting thread takes the socket over.
TEST_F(TheReceivingThreadBesideCalls, ReadsASlowReplyItselfWhileTheReceivingThreadSleepsInAHandler) {
    ASSERT_EQ(peer->setSignalHandlerString("Nap", &nap), 0);
    emit("Nap", "s", R"(["now"])");
    ASSERT_TRUE(waitUntil([] { return gNapping.load(); }));
    auto start = Clock::now();
    callPeer(*peer, "Later", 100u);
    EXPECT_LT(millisecondsSince(start), 100 + kPromptMs);
    EXPECT_TRUE(gNapping.load()) << "the handler woke before the reply: the test proves nothing";
}

TEST_F(TheReceivingThreadBesideCalls, LeavesAnOperationOnTheLoopsObjectItsOutcomeWhenASignalFailsToDecode) {
    ASSERT_EQ(peer->setSignalHandlerStringVariant("PropertyChanged", [](RemoteObject*, const char*, const Variant*) {}),
              0);
    LogCapture log;
    std::atomic<bool> done{ false };
    std::thread emitter([&] {
        auto other = peerObject();
        while (!done) callPeer(*other, "Emit", ObjectPath(kPeerPath), "PropertyChanged", "sv", R"(["Level", ["d", 1.5]])");
    });
    // One-way operations through the object the loop runs on, with the frame
    // every proxy operation uses: it would log an error left in the object.
    const internal::Op nothing = { "Nothing", internal::kOneWay, 99 };
    for (int i = 0; i < 3000; ++i)
        ASSERT_EQ(internal::call(loopOwner(), "threads", nothing, internal::kNoReply), 0);
    done = true;
    emitter.join();
    EXPECT_EQ(log.countEndingWith("Invalid reply value"), 0u);
    EXPECT_GT(log.countEndingWith("Failed to parse variant in signal"), 0u);
}

// Slow (libdbus's 25 s default): a test entry of its own, in a process whose
// session bus has a loop and whose system bus has none.
TEST(APendingCallToAPeerThatNeverAnswers, EndsAtTheDefaultTimeOutWithOrWithoutALoop) {
    startPeer();
    DBusConnection* system = dbus_bus_get(DBUS_BUS_SYSTEM, nullptr);
    ASSERT_NE(system, nullptr);
    // A path of this process that takes every call and answers none.
    DBusObjectPathVTable silent{};
    silent.message_function = [](DBusConnection*, DBusMessage*, void*) { return DBUS_HANDLER_RESULT_HANDLED; };
    auto check = [&silent](DBusConnection* connection, DBusBusType bus) {
        ASSERT_TRUE(dbus_connection_register_object_path(connection, "/org/btbus/Silent", &silent, nullptr));
        RemoteObject caller(dbus_bus_get_unique_name(connection), "/org/btbus/Silent", "org.btbus.Silent", bus);
        ASSERT_EQ(caller.newMessage("Wait"), 0);
        auto start = Clock::now();
        EXPECT_EQ(caller.sendMessagePending(), 0);
        EXPECT_GE(millisecondsSince(start), 24000);
        EXPECT_LE(millisecondsSince(start), 30000);
        ObjectPath path;
        EXPECT_EQ(caller.getReplyValue(path), -2);
        EXPECT_EQ(caller.getErrorNumber(), 11);
        EXPECT_EQ(caller.getErrorName(), "org.freedesktop.DBus.Error.NoReply");
    };
    std::thread withoutLoop([&] { check(system, DBUS_BUS_SYSTEM); });
    check(loopOwner().getConnection(), DBUS_BUS_SESSION);
    withoutLoop.join();
    dbus_connection_unref(system);
}

std::atomic<bool> gFilterCalled{ false };
DBusHandlerResult callFromProgramsFilter(DBusConnection*, DBusMessage* message, void*) {
    if (dbus_message_is_signal(message, kPeer, "Tick") && !gFilterCalled) {
        gInDispatch = callInsideDispatch();
        gFilterCalled = true;
    }
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
}

// Calls the peer through a connection the library does not use.
void callAside(DBusConnection* aside, const char* member, const dbus_uint32_t* argument = nullptr) {
    DBusMessage* call = dbus_message_new_method_call(kPeer, kPeerPath, kPeer, member);
    if (argument != nullptr) dbus_message_append_args(call, DBUS_TYPE_UINT32, argument, DBUS_TYPE_INVALID);
    DBusMessage* reply = dbus_connection_send_with_reply_and_block(aside, call, 3000, nullptr);
    EXPECT_NE(reply, nullptr) << member;
    if (reply != nullptr) dbus_message_unref(reply);
    dbus_message_unref(call);
}

// Without a receiving thread, a program that dispatches the connection with a
// loop of its own keeps its signals, and may call the library inside its
// dispatch (its own filter here, as dbus-glib's callbacks run).
TEST(AProgramsOwnLoop, KeepsItsSignalsAndMayCallTheLibraryInsideItsDispatch) {
    BTBUS_IN_OWN_PROCESS();
    startPeer();
    auto peer = peerObject();
    gCalls = 0;
    ASSERT_EQ(peer->setSignalHandlerString("Tick", &count), 0);
    DBusConnection* session = peer->getConnection();
    ASSERT_TRUE(dbus_connection_add_filter(session, &callFromProgramsFilter, nullptr, nullptr));
    std::atomic<bool> dispatching{ true };
    std::thread loop([&] {
        while (dispatching) dbus_connection_read_write_dispatch(session, 20);
    });
    DBusConnection* aside = dbus_bus_get_private(DBUS_BUS_SESSION, nullptr);
    ASSERT_NE(aside, nullptr);
    const dbus_uint32_t intervalMs = 1;
    callAside(aside, "StartTicking", &intervalMs);
    ASSERT_TRUE(waitUntil([] { return gFilterCalled.load(); }));
    EXPECT_EQ(gInDispatch, "answered, refused at once");
    std::this_thread::sleep_for(300ms);
    callAside(aside, "StopTicking");
    std::this_thread::sleep_for(100ms);
    dispatching = false;
    loop.join();
    EXPECT_EQ(internal::ConnectionLoop::of(session)->queued(), 0u) << "signals kept for a receiving thread to come";
    EXPECT_EQ(gCalls.load(), 0);
    dbus_connection_remove_filter(session, &callFromProgramsFilter, nullptr);
    dbus_connection_close(aside);
    dbus_connection_unref(aside);
}

// Stopping is final for the process, so this runs in a child of its own.
TEST(TheLoop, TakesOverACallMadeBeforeItStartedOutlivesItsObjectAndStopsForGood) {
    BTBUS_IN_OWN_PROCESS();
    startPeer();
    auto peer = peerObject();
    auto owner = peerObject();
    // A call that waits, made before any loop runs, has its reply once one does.
    std::thread early([] { callPeer(*peerObject(), "Later", 300u); });
    std::this_thread::sleep_for(100ms);
    ASSERT_EQ(owner->startLoop(), 0);
    early.join();

    // The loop goes on without the object it was started on.
    ASSERT_EQ(peer->setSignalHandlerString("Tick", &count), 0);
    callPeer(*peer, "StartTicking", 1u);
    ASSERT_TRUE(waitUntil([] { return gCalls > 0; }));
    owner.reset();
    int before = gCalls;
    EXPECT_TRUE(waitUntil([before] { return gCalls > before + 10; }));

    // Stopping through any object ends every receiving thread, and those started later at once.
    auto second = peerObject(kOtherPath);
    ASSERT_EQ(second->startLoop(), 0);
    peer->stopLoop();
    EXPECT_EQ(second->waitLoop(), 0);
    EXPECT_EQ(second->startLoop(), 0);
    EXPECT_EQ(second->waitLoop(), 0);
    EXPECT_NE(second->waitLoop(), 0);  // no thread to wait for: fails instead of crashing
    // The signals that still come are dropped, not queued for nobody.
    std::this_thread::sleep_for(500ms);
    for (int i = 0; i < 20; ++i) callPeer(*peer, "Echo", "x");
    callPeer(*peer, "StopTicking");
    EXPECT_GE(std::stoi(replyText(*peer)), 100);
    EXPECT_EQ(internal::ConnectionLoop::of(peer->getConnection())->queued(), 0u);
}

}  // namespace
