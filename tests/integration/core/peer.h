#ifndef BTBUS_TESTS_INTEGRATION_CORE_PEER_H
#define BTBUS_TESTS_INTEGRATION_CORE_PEER_H

#include <cstdlib>
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

// Calls method with string arguments and waits for the reply; fails the test
// if it cannot be sent.
template <typename... A>
void callPeer(Bluetooth::RemoteObject& peer, const char* method, const A&... args) {
    ASSERT_EQ(peer.newMessage(method), 0);
    int failed = 0;
    ((failed += peer.append(args) != 0), ...);
    ASSERT_EQ(failed, 0) << method << ": " << peer.getErrorMessage();
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

}  // namespace btbus_test

#endif
