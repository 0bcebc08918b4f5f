// Signals from a real peer through the receiving thread: the five signatures,
// matching without the path, malformed arguments, and removal on destruction.
#include <atomic>
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

void clearEvents() {
    std::lock_guard<std::mutex> lock(gLock);
    gEvents.clear();
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

// Registers the handler above that fits member's signature; any other member has no arguments.
int listen(RemoteObject& object, const std::string& member) {
    if (member == "PathSignal") return object.setSignalHandlerObjectPath(member.c_str(), &onPath);
    if (member == "StringSignal") return object.setSignalHandlerString(member.c_str(), &onString);
    if (member == "PropertyChanged") return object.setSignalHandlerStringVariant(member.c_str(), &onVariant);
    if (member == "DictSignal") return object.setSignalHandlerStringDict(member.c_str(), &onDict);
    return object.setSignalHandlerNoArgument(member.c_str(), &onBare);
}

class SignalTest : public PeerWithLoopTest {
protected:
    void SetUp() override {
        PeerWithLoopTest::SetUp();
        clearEvents();
    }

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

    LogCapture log;
};

using TheReceivingThread = SignalTest;

TEST_F(TheReceivingThread, DeliversEachSignatureToItsHandlersAndDictionariesUpToAnEmptyName) {
    auto object = peerObject();
    for (const char* member : { "PathSignal", "StringSignal", "PropertyChanged", "DictSignal", "Bare" })
        ASSERT_EQ(listen(*object, member), 0) << member;
    const struct {
        const char* kind;
        const char* event;
    } kCases[] = {
        { "path", "path /org/btbus/TestPeer /org/btbus/Thing" },
        { "string", "string /org/btbus/TestPeer text" },
        { "variant", "variant /org/btbus/TestPeer Powered=1" },
        { "dict", "dict /org/btbus/TestPeer 00:11:22:33:44:55 2 Class: 7936;RSSI: -5;" },
        // A handler without arguments receives the object whose thread dispatches.
        { "none", "bare /org/btbus/LoopOwner" },
        { "dict-emptyname", "dict /org/btbus/TestPeer 00:11 1 A: 1;" },
        { "dict-empty", "dict /org/btbus/TestPeer 00:11 0 " },
        { "dict-huge", "dict /org/btbus/TestPeer 00:11 50000 ..." },
    };
    for (const auto& row : kCases) emit(row.kind);
    for (const auto& row : kCases) EXPECT_TRUE(waitFor(row.event)) << row.kind;
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
    int noted;  // the error number left in the dispatching object's state
};

TEST_F(TheReceivingThread, LogsAMalformedSignalOnceAndStillOffersItToTheOtherLists) {
    const Malformed cases[] = {
        { "variant-double", "PropertyChanged", "Failed to parse variant in signal", 4 },
        { "variant-missing", "PropertyChanged", "Failed to parse variant in signal", 4 },
        { "variant-nested", "PropertyChanged", "Failed to parse variant in signal", 4 },
        { "variant-noargs", "PropertyChanged", "Signal has no arguments", 0 },
        { "variant-int", "PropertyChanged", "Argument is not string", 0 },
        { "string-noargs", "StringSignal", "Signal has no arguments", 0 },
        { "string-int", "StringSignal", "Argument is not string", 0 },
        { "path-string", "PathSignal", "Argument is not object path", 0 },
        { "path-noargs", "PathSignal", "Signal has no arguments", 0 },
        { "dict-notdict", "DictSignal", "Argument is not dict", 0 },
        { "dict-nosecond", "DictSignal", "Argument is not dict", 0 },
        { "dict-int", "DictSignal", "Argument is not string", 0 },
        { "dict-byte", "DictSignal", "Failed to parse entry value", 4 },
        { "dict-bytekeys", "DictSignal", "Failed to parse entry name", 4 },
    };
    for (const Malformed& c : cases) {
        SCOPED_TRACE(c.kind);
        clearEvents();
        log.clear();
        loopOwner().resetError();
        // The first object's match rules are the ones that bring the signal here.
        auto first = peerObject();
        auto second = peerObject("/org/btbus/Second");
        ASSERT_EQ(listen(*first, c.member), 0);
        ASSERT_EQ(listen(*second, c.member), 0);
        ASSERT_EQ(first->setSignalHandlerNoArgument(c.member, &onBare), 0);
        auto sentinel = peerObject();
        emit(c.kind);
        drain(*sentinel);

        // Only the other list's handler and the sentinel's were called.
        EXPECT_EQ(events(), (std::vector<std::string>{ "bare /org/btbus/LoopOwner",
                                                       std::string("string ") + kPeerPath + " done" }));
        ASSERT_EQ(log.lines().size(), 1u);
        EXPECT_EQ(log.from("remote_object.cpp"), std::vector<std::string>{ c.logged });
        // Decoding errors go to the object whose loop dispatched, not to the handlers' own.
        EXPECT_EQ(loopOwner().getErrorNumber(), c.noted);
        EXPECT_EQ(first->getErrorNumber(), 0);
    }
}

}  // namespace
