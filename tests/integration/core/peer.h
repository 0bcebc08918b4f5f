#ifndef BTBUS_TESTS_INTEGRATION_CORE_PEER_H
#define BTBUS_TESTS_INTEGRATION_CORE_PEER_H

#include <cstdlib>
#include <memory>
#include <string>

#include <gtest/gtest.h>

#include <bluetooth/remote_object.h>

#include "support/process.h"

namespace btbus_test {

constexpr const char* kPeer = "org.btbus.TestPeer";  // the peer's bus name and interface
constexpr const char* kPeerPath = "/org/btbus/TestPeer";
constexpr const char* kOtherPath = "/org/btbus/Other";

// Starts the core's test peer (tests/support/core_peer.py) on the private
// session bus once; it is stopped at exit.
inline void startPeer() {
    static pid_t pid = -1;
    requireDbusmock();
    if (pid > 0) return;
    pid = spawn({ kDebianPython, "-m", "dbusmock", "--session", "-l", scratchDir() + "/peer.log", "-t",
                  std::string(BTBUS_SOURCE_DIR) + "/tests/support/core_peer.py" });
    ASSERT_GT(pid, 0);
    std::atexit([] { stop(pid); });
    ASSERT_TRUE(waitForName(DBUS_BUS_SESSION, kPeer)) << "the test peer did not start: see " << scratchDir();
}

// A proxy for the peer's object at path.
inline std::unique_ptr<Bluetooth::RemoteObject> peerObject(const char* path = kPeerPath) {
    return std::make_unique<Bluetooth::RemoteObject>(kPeer, path, kPeer, DBUS_BUS_SESSION);
}

// Builds a call of method with args, not yet sent; fails the test if it cannot.
template <typename... A>
void buildCall(Bluetooth::RemoteObject& peer, const char* method, const A&... args) {
    int failed = peer.newMessage(method) != 0;
    ((failed += peer.append(args) != 0), ...);
    ASSERT_EQ(failed, 0) << method << ": " << peer.getErrorMessage();
}

// Calls method with args and waits for the reply; fails the test if the call fails.
template <typename... A>
void callPeer(Bluetooth::RemoteObject& peer, const char* method, const A&... args) {
    ASSERT_NO_FATAL_FAILURE(buildCall(peer, method, args...));
    ASSERT_EQ(peer.sendMessage(true, -1), 0) << method << ": " << peer.getErrorMessage();
}

// The reply's string, read once; when it has none, the reason.
inline std::string replyText(Bluetooth::RemoteObject& peer) {
    std::string text;
    return peer.getReplyValue(text) == 0 ? text : "no text: " + peer.getErrorMessage();
}

// A JSON dictionary of count entries "k0", "k1"... that each hold value.
inline std::string manyEntries(int count, const std::string& value) {
    std::string json = "{";
    for (int i = 0; i < count; ++i) json += (i == 0 ? "\"k" : ", \"k") + std::to_string(i) + "\": " + value;
    return json + "}";
}

// The receiving thread of this binary on bus: started on first use, on an
// object of its own, and left running until exit (stopping is final).
inline Bluetooth::RemoteObject& loopOwner(DBusBusType bus = DBUS_BUS_SESSION) {
    struct Owner : Bluetooth::RemoteObject {
        explicit Owner(DBusBusType bus) : RemoteObject(kPeer, "/org/btbus/LoopOwner", kPeer, bus) {
            EXPECT_EQ(startLoop(), 0);
        }
        ~Owner() override {  // at exit, before the handler lists are destroyed
            stopLoop();
            waitLoop();
        }
    };
    if (bus == DBUS_BUS_SYSTEM) {
        static Owner system(bus);
        return system;
    }
    static Owner session(bus);
    return session;
}

// A test against the peer with this binary's receiving thread running.
class PeerWithLoopTest : public ::testing::Test {
protected:
    void SetUp() override {
        startPeer();
        loopOwner();
        peer = peerObject();
    }
    // The peer sends member from its path with arguments of types signature, as JSON.
    void emit(const char* member, const char* signature, const std::string& arguments) {
        callPeer(*peer, "Emit", Bluetooth::ObjectPath(kPeerPath), member, signature, arguments.c_str());
    }
    std::unique_ptr<Bluetooth::RemoteObject> peer;
};

}  // namespace btbus_test

#endif
