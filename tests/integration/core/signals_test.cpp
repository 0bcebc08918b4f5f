// Signals from a real peer through the receiving thread: the five signatures,
// matching without the path, malformed arguments, and removal on destruction.
#include <algorithm>
#include <mutex>

#include <gtest/gtest.h>

#include <bluetooth/util.h>

#include "integration/core/peer.h"
#include "support/log_capture.h"

using namespace Bluetooth;
using namespace btbus_test;

namespace {

std::mutex gLock;
std::vector<std::string> gEvents;  // "kind path arguments", as the handlers below were called

void note(const char* kind, RemoteObject* object, const std::string& arguments) {
    std::lock_guard<std::mutex> lock(gLock);
    gEvents.push_back(std::string(kind) + " " + object->getPath() + arguments);
}

std::vector<std::string> events() {
    std::lock_guard<std::mutex> lock(gLock);
    return gEvents;
}

size_t count(const std::string& event) {
    std::lock_guard<std::mutex> lock(gLock);
    return std::count(gEvents.begin(), gEvents.end(), event);
}

void onPath(RemoteObject* object, const ObjectPath* path) { note("path", object, " " + path->str()); }
void onString(RemoteObject* object, const char* text) { note("string", object, std::string(" ") + text); }
void onVariant(RemoteObject* object, const char* name, const Variant* value) {
    note("variant", object, std::string(" ") + name + "=" + variantToString(*value));
}
void onDict(RemoteObject* object, const char* name, const Dict* dict) {
    std::string separator = ";";
    note("dict", object, std::string(" ") + name + " " + std::to_string(dict->size()) + " " +
                             (dict->size() < 10 ? dictConquerToString(*dict, separator) : std::string("...")));
}
void onBare(RemoteObject* object) { note("bare", object, ""); }

// Registers the handler above that fits member's signature; any other member has no arguments.
int listen(RemoteObject& object, const std::string& member) {
    if (member == "PathSignal") return object.setSignalHandlerObjectPath(member.c_str(), &onPath);
    if (member == "StringSignal") return object.setSignalHandlerString(member.c_str(), &onString);
    if (member == "PropertyChanged") return object.setSignalHandlerStringVariant(member.c_str(), &onVariant);
    if (member == "DictSignal") return object.setSignalHandlerStringDict(member.c_str(), &onDict);
    return object.setSignalHandlerNoArgument(member.c_str(), &onBare);
}

class TheReceivingThread : public PeerWithLoopTest {
protected:
    void SetUp() override {
        PeerWithLoopTest::SetUp();
        std::lock_guard<std::mutex> lock(gLock);
        gEvents.clear();
    }

    bool waitFor(const std::string& event) { return waitUntil([&] { return count(event) > 0; }); }
    LogCapture log;
};

TEST_F(TheReceivingThread, DeliversEachSignatureToEveryHandlerOfTheInterfaceWhateverPathSentItTillItsObjectGoes) {
    auto object = peerObject();
    auto other = peerObject(kOtherPath);
    for (const char* member : { "PathSignal", "StringSignal", "StringSignal", "PropertyChanged", "DictSignal" })
        ASSERT_EQ(listen(*object, member), 0) << member;
    ASSERT_EQ(listen(*other, "PropertyChanged"), 0);
    const struct {
        const char *member, *signature;  // null: the signal of the row before
        std::string arguments;
        const char* event;
    } kCases[] = {
        { "PathSignal", "o", R"(["/org/btbus/Thing"])", "path /org/btbus/TestPeer /org/btbus/Thing" },
        { "StringSignal", "s", R"(["text"])", "string /org/btbus/TestPeer text" },
        { "PropertyChanged", "sv", R"(["Powered", ["b", true]])", "variant /org/btbus/TestPeer Powered=1" },
        { nullptr, nullptr, "", "variant /org/btbus/Other Powered=1" },  // sent from the peer's path
        { "DictSignal", "sa{sv}", R"(["00:11:22:33:44:55", {"Class": ["u", 7936], "RSSI": ["n", -5]}])",
          "dict /org/btbus/TestPeer 00:11:22:33:44:55 2 Class: 7936;RSSI: -5;" },
        { "DictSignal", "sa{sv}", R"(["00:11", {"A": ["u", 1], "": ["u", 2], "B": ["u", 3]}])",
          "dict /org/btbus/TestPeer 00:11 1 A: 1;" },
        { "DictSignal", "sa{sv}", R"(["00:11", {}])", "dict /org/btbus/TestPeer 00:11 0 " },
        { "DictSignal", "sa{sv}", "[\"00:11\", " + manyEntries(50000, R"(["s", "xxxxxxxxxx"])") + "]",
          "dict /org/btbus/TestPeer 00:11 50000 ..." },
    };
    for (const auto& row : kCases)
        if (row.member != nullptr) emit(row.member, row.signature, row.arguments);
    for (const auto& row : kCases) EXPECT_TRUE(waitFor(row.event)) << row.event;
    EXPECT_TRUE(waitUntil([] { return count("string /org/btbus/TestPeer text") == 2; })) << "registered twice";
    RemoteObject* raw = object.get();
    object.reset();
    for (auto& handler : RemoteObject::signalHandlerVectorString) EXPECT_NE(handler.object, raw);
    // Both of its StringSignal match rules left the bus: one more removal finds none.
    DBusError error;
    dbus_error_init(&error);
    dbus_bus_remove_match(peer->getConnection(),
                          "type='signal',interface='org.btbus.TestPeer',member='StringSignal',path='/org/btbus/TestPeer'",
                          &error);
    EXPECT_STREQ(error.name, DBUS_ERROR_MATCH_RULE_NOT_FOUND);
    dbus_error_free(&error);
    EXPECT_TRUE(log.lines().empty());
}

TEST_F(TheReceivingThread, LogsAMalformedSignalOnceAndStillOffersItToTheOtherLists) {
    const struct {
        const char *member, *signature, *arguments, *logged;
        int noted;  // the error number left in the dispatching object's state
    } kCases[] = {
        { "PropertyChanged", "sv", R"(["Level", ["d", 1.5]])", "Failed to parse variant in signal", 4 },
        { "PropertyChanged", "s", R"(["Level"])", "Failed to parse variant in signal", 4 },
        { "PropertyChanged", "sv", R"(["Level", ["aa{sv}", [{"a": ["y", 1]}]]])", "Failed to parse variant in signal", 4 },
        { "PropertyChanged", "", "[]", "Signal has no arguments", 0 },
        { "PropertyChanged", "iv", R"([1, ["b", true]])", "Argument is not string", 0 },
        { "StringSignal", "", "[]", "Signal has no arguments", 0 },
        { "StringSignal", "i", "[1]", "Argument is not string", 0 },
        { "PathSignal", "", "[]", "Signal has no arguments", 0 },
        { "PathSignal", "s", R"(["/not/a/path/argument"])", "Argument is not object path", 0 },
        { "DictSignal", "s", R"(["00:11"])", "Argument is not dict", 0 },
        { "DictSignal", "sas", R"(["00:11", ["x"]])", "Argument is not dict", 0 },
        { "DictSignal", "ia{sv}", "[1, {}]", "Argument is not string", 0 },
        { "DictSignal", "sa{sv}", R"(["00:11", {"Name": ["s", "n"], "Bad": ["y", 1]}])", "Failed to parse entry value", 4 },
        { "DictSignal", "sa{yv}", R"(["00:11", {"1": ["s", "x"]}])", "Failed to parse entry name", 4 },
    };
    for (const auto& c : kCases) {
        SCOPED_TRACE(std::string(c.member) + "(" + c.signature + ") " + c.arguments);
        SetUp();  // no events, and a peer without the last sentinel's handler
        log.clear();
        loopOwner().resetError();
        // The first object's match rules are the ones that bring the signal here.
        auto first = peerObject();
        auto second = peerObject("/org/btbus/Second");
        ASSERT_EQ(listen(*first, c.member), 0);
        ASSERT_EQ(listen(*second, c.member), 0);
        ASSERT_EQ(first->setSignalHandlerNoArgument(c.member, &onBare), 0);
        emit(c.member, c.signature, c.arguments);
        // A good signal after it, whose handler is at the path it comes from (the bus
        // sends nothing else here): once that one is handled, so is the one before.
        ASSERT_EQ(peer->setSignalHandlerString("Sentinel", &onString), 0);
        emit("Sentinel", "s", R"(["done"])");
        ASSERT_TRUE(waitFor("string /org/btbus/TestPeer done"));

        // Only the argument-less handler, given the object whose thread dispatches, and the sentinel ran.
        EXPECT_EQ(events(), (std::vector<std::string>{ "bare /org/btbus/LoopOwner", "string /org/btbus/TestPeer done" }));
        EXPECT_EQ(log.from("remote_object.cpp"), std::vector<std::string>{ c.logged });
        EXPECT_EQ(log.lines().size(), 1u);
        // Decoding errors go to the object whose loop dispatched, not to the handlers' own.
        EXPECT_EQ(loopOwner().getErrorNumber(), c.noted);
        EXPECT_EQ(first->getErrorNumber(), 0);
    }
}

}  // namespace
