#ifndef BTBUS_TESTS_INTEGRATION_CORE_PEER_H
#define BTBUS_TESTS_INTEGRATION_CORE_PEER_H

#include <atomic>
#include <cstdlib>
#include <thread>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include <bluetooth/remote_object.h>

#include "support/process.h"

namespace btbus_test {

constexpr const char* kPeerName = "org.btbus.TestPeer";
constexpr const char* kPeerPath = "/org/btbus/TestPeer";
constexpr const char* kPeerInterface = "org.btbus.TestPeer";
constexpr const char* kOtherPath = "/org/btbus/Other";

// The core's test peer (tests/support/core_peer.py) on the private session bus,
// started by the first test that needs it and stopped at exit.
class Peer {
public:
    static void ensureStarted() {
        requireDbusmock();
        if (pid_ > 0) return;
        pid_ = spawn({ kDebianPython, "-m", "dbusmock", "--session", "-l", scratchDir() + "/peer.log", "-t",
                       std::string(BTBUS_SOURCE_DIR) + "/tests/support/core_peer.py" });
        ASSERT_GT(pid_, 0);
        std::atexit([] { stop(pid_); });
        ASSERT_TRUE(waitForName(DBUS_BUS_SESSION, kPeerName)) << "the test peer did not start; see "
                                                              << scratchDir() << "/peer.log";
    }

private:
    static inline pid_t pid_ = -1;
};

// A proxy for the peer's object at path.
inline std::unique_ptr<Bluetooth::RemoteObject> peerObject(const char* path = kPeerPath) {
    return std::make_unique<Bluetooth::RemoteObject>(kPeerName, path, kPeerInterface, DBUS_BUS_SESSION);
}

// Builds a call of method with args, not yet sent; fails the test if an
// argument cannot be written.
template <typename... A>
void buildCall(Bluetooth::RemoteObject& peer, const char* method, const A&... args) {
    ASSERT_EQ(peer.newMessage(method), 0);
    int failed = 0;
    ((failed += peer.append(args) != 0), ...);
    ASSERT_EQ(failed, 0) << method << ": " << peer.getErrorMessage();
}

// Calls method with args and waits for the reply; fails the test if it cannot
// be sent.
template <typename... A>
void callPeer(Bluetooth::RemoteObject& peer, const char* method, const A&... args) {
    ASSERT_NO_FATAL_FAILURE(buildCall(peer, method, args...));
    ASSERT_EQ(peer.sendMessage(true, -1), 0) << method << ": " << peer.getErrorMessage();
}

// What the peer's one-way recording methods received, in order.
inline std::vector<std::string> recorded() {
    auto peer = peerObject();
    std::vector<std::string> lines;
    callPeer(*peer, "Recorded");
    EXPECT_EQ(peer->getReplyValue(lines), 0);
    return lines;
}

// The one receiving thread of this binary: started once, on an object of its
// own, and left running (stopping it is final for the process).
inline Bluetooth::RemoteObject* gLoopOwner = nullptr;

inline Bluetooth::RemoteObject& loopOwner() {
    if (gLoopOwner == nullptr) {
        gLoopOwner = new Bluetooth::RemoteObject(kPeerName, "/org/btbus/LoopOwner", kPeerInterface,
                                                 DBUS_BUS_SESSION);
        EXPECT_EQ(gLoopOwner->startLoop(), 0);
        // Before the buses go and before the handler lists are destroyed.
        std::atexit([] {
            gLoopOwner->stopLoop();
            gLoopOwner->waitLoop();
        });
    }
    return *gLoopOwner;
}

// A test against the peer with this binary's receiving thread running.
class PeerWithLoopTest : public ::testing::Test {
protected:
    void SetUp() override {
        Peer::ensureStarted();
        loopOwner();
        peer = peerObject();
    }
    void emit(const char* kind) { callPeer(*peer, "Emit", kind); }
    std::unique_ptr<Bluetooth::RemoteObject> peer;
};

// Answers call with one string.
inline void replyWith(DBusConnection* connection, DBusMessage* call, const char* text) {
    DBusMessage* reply = dbus_message_new_method_return(call);
    dbus_message_append_args(reply, DBUS_TYPE_STRING, &text, DBUS_TYPE_INVALID);
    dbus_connection_send(connection, reply, nullptr);
    dbus_message_unref(reply);
}

// Answers org.btbus.Callback.Ping with "pong: <word>" and notes the thread.
struct CallbackState {
    std::atomic<std::thread::id> thread{};
    std::atomic<int> calls{ 0 };
};

inline DBusHandlerResult answerPing(DBusConnection* connection, DBusMessage* message, void* data) {
    if (!dbus_message_is_method_call(message, "org.btbus.Callback", "Ping"))
        return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
    auto* state = static_cast<CallbackState*>(data);
    state->thread = std::this_thread::get_id();
    ++state->calls;
    const char* word = nullptr;
    dbus_message_get_args(message, nullptr, DBUS_TYPE_STRING, &word, DBUS_TYPE_INVALID);
    replyWith(connection, message, (std::string("pong: ") + (word ? word : "")).c_str());
    dbus_connection_flush(connection);  // as the agent does
    return DBUS_HANDLER_RESULT_HANDLED;
}

// An object path served on the shared session connection, as an agent is;
// answerPing by default.
class ServedPath {
public:
    explicit ServedPath(Bluetooth::RemoteObject& on, DBusObjectPathMessageFunction answer = &answerPing)
        : connection_(on.getConnection()) {
        vtable_.message_function = answer;
        EXPECT_TRUE(dbus_connection_register_object_path(connection_, kPath, &vtable_, &state));
    }
    ~ServedPath() { dbus_connection_unregister_object_path(connection_, kPath); }
    static constexpr const char* kPath = "/org/btbus/Callback";
    CallbackState state;

private:
    DBusConnection* connection_;
    DBusObjectPathVTable vtable_{};
};

}  // namespace btbus_test

#endif
