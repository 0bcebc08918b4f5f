// Signals from a real peer through the receiving thread: the five signatures,
// matching without the path, malformed arguments, and removal on destruction.
#include <atomic>
#include <functional>
#include <map>
#include <mutex>

#include <gtest/gtest.h>

#include <bluetooth/util.h>

#include "integration/core/peer.h"
#include "support/log_capture.h"

using namespace Bluetooth;
using namespace btbus_test;

namespace {

std::mutex gLock;
std::vector<std::string> gEvents;

void note(const std::string& event) {
    std::lock_guard<std::mutex> lock(gLock);
    gEvents.push_back(event);
}

std::vector<std::string> events() {
    std::lock_guard<std::mutex> lock(gLock);
    return gEvents;
}

size_t countStartingWith(const std::string& prefix) {
    size_t n = 0;
    for (const std::string& event : events()) n += event.compare(0, prefix.size(), prefix) == 0;
    return n;
}

void onPath(RemoteObject* object, const ObjectPath* path) {
    note(std::string("path ") + object->getPath() + " " + path->str());
}
void onString(RemoteObject* object, const char* text) { note(std::string("string ") + object->getPath() + " " + text); }
void onVariant(RemoteObject* object, const char* name, const Variant* value) {
    note(std::string("variant ") + object->getPath() + " " + name + "=" + variantToString(*value));
}
void onDict(RemoteObject* object, const char* name, const Dict* dict) {
    std::string separator = ";";
    note(std::string("dict ") + object->getPath() + " " + name + " " + std::to_string(dict->size()) + " " +
         (dict->size() < 10 ? dictConquerToString(*dict, separator) : std::string("...")));
}
void onBare(RemoteObject* object) { note(std::string("bare ") + object->getPath()); }

class SignalTest : public ::testing::Test {
protected:
    void SetUp() override {
        Peer::ensureStarted();
        loopOwner();
        peer = peerObject();
        std::lock_guard<std::mutex> lock(gLock);
        gEvents.clear();
    }

    void emit(const char* kind) { callPeer(*peer, "Emit", kind); }

    bool waitFor(const std::string& event) {
        return waitUntil([&] {
            auto all = events();
            return std::find(all.begin(), all.end(), event) != all.end();
        });
    }

    // Emits a good signal after the ones under test and waits for it: the loop
    // handles messages in order, so everything before it has been handled. The
    // bus delivers a signal only where a match rule names its path: objects at
    // other paths hear it only through the rule of an object at the peer's path.
    void drain(RemoteObject& sentinelOwner) {
        ASSERT_EQ(sentinelOwner.setSignalHandlerString("Sentinel", &onString), 0);
        emit("sentinel");
        ASSERT_TRUE(waitFor(std::string("string ") + sentinelOwner.getPath() + " done"));
    }

    std::unique_ptr<RemoteObject> peer;
    LogCapture log;
};

using TheReceivingThread = SignalTest;

TEST_F(TheReceivingThread, DeliversEachSignatureToItsHandlers) {
    auto object = peerObject();
    ASSERT_EQ(object->setSignalHandlerObjectPath("PathSignal", &onPath), 0);
    ASSERT_EQ(object->setSignalHandlerString("StringSignal", &onString), 0);
    ASSERT_EQ(object->setSignalHandlerStringVariant("PropertyChanged", &onVariant), 0);
    ASSERT_EQ(object->setSignalHandlerStringDict("DictSignal", &onDict), 0);
    ASSERT_EQ(object->setSignalHandlerNoArgument("Bare", &onBare), 0);
    for (const char* kind : { "path", "string", "variant", "dict", "none" }) emit(kind);

    EXPECT_TRUE(waitFor("path /org/btbus/TestPeer /org/btbus/Thing"));
    EXPECT_TRUE(waitFor("string /org/btbus/TestPeer text"));
    EXPECT_TRUE(waitFor("variant /org/btbus/TestPeer Powered=1"));
    EXPECT_TRUE(waitFor("dict /org/btbus/TestPeer 00:11:22:33:44:55 2 Class: 7936;RSSI: -5;"));
    // A handler without arguments receives the object whose thread dispatches.
    EXPECT_TRUE(waitFor("bare /org/btbus/LoopOwner"));
    EXPECT_TRUE(log.lines().empty());
}

TEST_F(TheReceivingThread, CallsEveryHandlerOfTheInterfaceWhateverPathSent) {
    auto mine = peerObject(kPeerPath);
    auto other = peerObject(kOtherPath);
    ASSERT_EQ(mine->setSignalHandlerStringVariant("PropertyChanged", &onVariant), 0);
    ASSERT_EQ(other->setSignalHandlerStringVariant("PropertyChanged", &onVariant), 0);
    emit("variant");
    EXPECT_TRUE(waitFor("variant /org/btbus/TestPeer Powered=1"));
    EXPECT_TRUE(waitFor("variant /org/btbus/Other Powered=1"));
    emit("variant-other-path");
    EXPECT_TRUE(waitFor("variant /org/btbus/TestPeer Alias=other"));
    EXPECT_TRUE(waitFor("variant /org/btbus/Other Alias=other"));
}

std::atomic<int> gStringSignalsSeen{ 0 };

DBusHandlerResult countStringSignals(DBusConnection*, DBusMessage* message, void*) {
    if (dbus_message_is_signal(message, kPeerInterface, "StringSignal")) ++gStringSignalsSeen;
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
}

TEST_F(TheReceivingThread, CallsATwiceRegisteredHandlerTwiceUntilItsObjectIsDestroyed) {
    auto twice = peerObject();
    RemoteObject* raw = twice.get();
    ASSERT_EQ(twice->setSignalHandlerString("StringSignal", &onString), 0);
    ASSERT_EQ(twice->setSignalHandlerString("StringSignal", &onString), 0);
    emit("string");
    EXPECT_TRUE(waitUntil([] { return countStartingWith("string /org/btbus/TestPeer text") == 2; }));

    DBusConnection* connection = peer->getConnection();
    ASSERT_TRUE(dbus_connection_add_filter(connection, &countStringSignals, nullptr, nullptr));
    twice.reset();
    for (auto& handler : RemoteObject::signalHandlerVectorString) EXPECT_NE(handler.object, raw);

    // With its match rules gone the bus no longer sends the signal here at all.
    auto witness = peerObject();
    ASSERT_EQ(witness->setSignalHandlerObjectPath("PathSignal", &onPath), 0);
    emit("string");
    emit("path");
    EXPECT_TRUE(waitFor("path /org/btbus/TestPeer /org/btbus/Thing"));
    dbus_connection_remove_filter(connection, &countStringSignals, nullptr);
    EXPECT_EQ(gStringSignalsSeen.load(), 0);
    EXPECT_EQ(countStartingWith("string /org/btbus/TestPeer"), 2u);
    EXPECT_EQ(log.countEndingWith("Remove match error"), 0u);
}

struct Malformed {
    const char* kind;
    const char* member;
    const char* logged;
};

TEST_F(TheReceivingThread, LogsAMalformedSignalOnceAndStillOffersItToTheOtherLists) {
    const Malformed cases[] = {
        { "variant-double", "PropertyChanged", "Failed to parse variant in signal" },
        { "variant-missing", "PropertyChanged", "Failed to parse variant in signal" },
        { "variant-nested", "PropertyChanged", "Failed to parse variant in signal" },
        { "variant-noargs", "PropertyChanged", "Signal has no arguments" },
        { "variant-int", "PropertyChanged", "Argument is not string" },
        { "string-noargs", "StringSignal", "Signal has no arguments" },
        { "string-int", "StringSignal", "Argument is not string" },
        { "path-string", "PathSignal", "Argument is not object path" },
        { "path-noargs", "PathSignal", "Signal has no arguments" },
        { "dict-notdict", "DictSignal", "Argument is not dict" },
        { "dict-nosecond", "DictSignal", "Argument is not dict" },
        { "dict-int", "DictSignal", "Argument is not string" },
        { "dict-byte", "DictSignal", "Failed to parse entry value" },
        { "dict-bytekeys", "DictSignal", "Failed to parse entry name" },
    };
    std::map<std::string, std::function<int(RemoteObject&)>> registerFor = {
        { "PropertyChanged", [](RemoteObject& o) { return o.setSignalHandlerStringVariant("PropertyChanged", &onVariant); } },
        { "StringSignal", [](RemoteObject& o) { return o.setSignalHandlerString("StringSignal", &onString); } },
        { "PathSignal", [](RemoteObject& o) { return o.setSignalHandlerObjectPath("PathSignal", &onPath); } },
        { "DictSignal", [](RemoteObject& o) { return o.setSignalHandlerStringDict("DictSignal", &onDict); } },
    };
    for (const Malformed& c : cases) {
        SCOPED_TRACE(c.kind);
        {
            std::lock_guard<std::mutex> lock(gLock);
            gEvents.clear();
        }
        log.clear();
        loopOwner().resetError();
        // The first object's match rules are the ones that bring the signal here.
        auto first = peerObject();
        auto second = peerObject("/org/btbus/Second");
        ASSERT_EQ(registerFor[c.member](*first), 0);
        ASSERT_EQ(registerFor[c.member](*second), 0);
        ASSERT_EQ(first->setSignalHandlerNoArgument(c.member, &onBare), 0);
        auto sentinel = peerObject();
        emit(c.kind);
        drain(*sentinel);

        EXPECT_EQ(countStartingWith("bare /org/btbus/LoopOwner"), 1u) << "the other lists were not offered it";
        size_t delivered = 0;
        for (const std::string& event : events())
            delivered += event != std::string("string ") + kPeerPath + " done" &&
                         (event.find(kPeerPath) != std::string::npos ||
                          event.find("/org/btbus/Second") != std::string::npos);
        EXPECT_EQ(delivered, 0u);
        ASSERT_EQ(log.lines().size(), 1u);
        EXPECT_EQ(log.lines()[0].rfind("remote_object.cpp:", 0), 0u) << log.lines()[0];
        EXPECT_EQ(log.countEndingWith(std::string(" ") + c.logged), 1u) << log.lines()[0];
    }
}

TEST_F(TheReceivingThread, PutsDecodingErrorsInTheDispatchingObjectsState) {
    auto object = peerObject();
    ASSERT_EQ(object->setSignalHandlerStringVariant("PropertyChanged", &onVariant), 0);
    loopOwner().resetError();
    emit("variant-double");
    auto sentinel = peerObject();
    drain(*sentinel);
    EXPECT_EQ(loopOwner().getErrorNumber(), 4);
    EXPECT_EQ(object->getErrorNumber(), 0);
}

TEST_F(TheReceivingThread, DecodesDictionarySignalsUpToAnEmptyName) {
    auto object = peerObject();
    ASSERT_EQ(object->setSignalHandlerStringDict("DictSignal", &onDict), 0);
    emit("dict-emptyname");
    EXPECT_TRUE(waitFor("dict /org/btbus/TestPeer 00:11 1 A: 1;"));
    emit("dict-empty");
    EXPECT_TRUE(waitFor("dict /org/btbus/TestPeer 00:11 0 "));
    emit("dict-huge");
    EXPECT_TRUE(waitFor("dict /org/btbus/TestPeer 00:11 50000 ..."));
    EXPECT_TRUE(log.lines().empty());
}

}  // namespace
