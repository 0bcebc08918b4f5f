// Method calls against a real dbus-daemon and a dbusmock peer: replies of every
// shape, arguments of every type, errors, time-outs and interrupted waits.
#include <csignal>
#include <thread>

#include <gtest/gtest.h>
#include <unistd.h>

#include <bluetooth/util.h>

#include "core/loop_flags.h"
#include "integration/core/peer.h"

using namespace Bluetooth;
using namespace btbus_test;

namespace {

class ARemoteObject : public ::testing::Test {
protected:
    void SetUp() override {
        startPeer();
        peer = peerObject();
    }

    // Has the peer answer value (JSON) of type signature; reads it into out expecting result and number.
    template <typename T>
    void read(const char* signature, const std::string& value, T& out, int result, int number = 0) {
        callPeer(*peer, "Reply", signature, value.c_str());
        EXPECT_EQ(peer->getReplyValue(out), result) << signature << " " << value;
        if (result != 0) EXPECT_EQ(peer->getErrorNumber(), number) << signature << " " << value;
    }

    std::unique_ptr<RemoteObject> peer;
};

TEST_F(ARemoteObject, ReadsScalarAndTextArrayRepliesOnceAndRefusesOtherTypes) {
    std::string text = "untouched";
    bool truth = false;
    ObjectPath path;
    read("b", "true", text, -1, 4);
    EXPECT_EQ(text, "untouched");
    read("s", R"("hello")", truth, -1, 4);
    read("s", R"("hello")", text, 0);
    EXPECT_EQ(text, "hello");
    EXPECT_EQ(peer->getReplyValue(text), -1);
    EXPECT_EQ(peer->getErrorNumber(), 2);
    read("b", "true", truth, 0);
    EXPECT_TRUE(truth);
    read("o", R"("/org/btbus/Thing")", path, 0);
    EXPECT_STREQ(path, "/org/btbus/Thing");

    // A string where a path was expected is the peer's error text; any other
    // type is error 11 with the text left as it was.
    read("s", R"("peer error text")", path, -2, 11);
    EXPECT_STREQ(path, "peer error text");
    EXPECT_EQ(peer->getErrorMessage(), "peer error text");
    read("i", "5", path, -1, 11);
    EXPECT_EQ(peer->getErrorMessage(), "peer error text");

    std::vector<std::string> texts{ "stale" };
    read("as", R"(["a", "b", "c"])", texts, 0);
    EXPECT_EQ(texts, (std::vector<std::string>{ "a", "b", "c" }));
    read("as", "[]", texts, 0);
    EXPECT_TRUE(texts.empty());
    read("s", R"("a")", texts, -1, 4);
    read("ai", "[1, 2]", texts, -1, 4);

    std::vector<ObjectPath> paths{ ObjectPath("/stale") };
    read("ao", R"(["/a", "/b/c"])", paths, 0);
    ASSERT_EQ(paths.size(), 2u);
    EXPECT_STREQ(paths[1], "/b/c");
    read("ao", "[]", paths, 0);
    EXPECT_TRUE(paths.empty());
}

// Each entry as name=alternative:text, the alternative being Variant's index.
std::string describe(const Dict& dict) {
    std::string text;
    for (const Entry& entry : dict)
        text += entry.first + "=" + std::to_string(entry.second.which()) + ":" + variantToString(entry.second) + ";";
    return text;
}

TEST_F(ARemoteObject, DecodesDictionariesInArrivalOrderUpToAValueItCannotHold) {
    const struct {
        const char *signature, *value;
        int result, number;
        const char* entries;  // read into a dictionary that held one stale entry
    } kCases[] = {
        { "a{sv}",
          R"({"Address": ["s", "00:11:22:33:44:55"], "Class": ["u", 7936], "Paired": ["b", false], "UUIDs": )"
          R"(["as", ["0000110b-0000-1000-8000-00805f9b34fb", "x"]], "RSSI": ["n", -60], "Vendor": ["q", 65535], )"
          R"("Adapter": ["o", "/org/bluez/1/hci0"], "Devices": ["ao", ["/d/1", "/d/2"]], "Empty": ["ay", []]})", 0, 0,
          "Address=3:00:11:22:33:44:55;Class=0:7936;Paired=2:0;UUIDs=4:[0000110b-0000-1000-8000-00805f9b34fb, x];"
          "RSSI=5:-60;Vendor=1:65535;Adapter=3:/org/bluez/1/hci0;Devices=4:[/d/1, /d/2];Empty=4:[];" },
        { "a{sv}", R"({"A": ["u", 1], "B": ["u", 2], "": ["u", 3], "C": ["u", 4]})", 0, 0, "A=0:1;B=0:2;" },
        { "a{uv}", R"({"1": ["s", "one"], "2": ["u", 2]})", 0, 0, "1=3:one;2=0:2;" },
        { "a{us}", R"({"65537": "<record/>", "2": "two"})", 0, 0, "65537=3:<record/>;2=3:two;" },  // services
        // The entries before a value it cannot hold are kept.
        { "a{sv}", R"({"Name": ["s", "before"], "Bad": ["y", 3], "After": ["s", "x"]})", -1, 4, "Name=3:before;" },
        { "a{sv}", R"({"Level": ["i", -1]})", -1, 4, "" },
        { "a{sv}", R"({"Nested": ["v", ["s", "x"]]})", -1, 4, "" },
        // Untouched before the format is known.
        { "s", R"("a")", -1, 5, "stale=0:1;" },
        { "as", R"(["a"])", -1, 5, "stale=0:1;" },
    };
    for (const auto& row : kCases) {
        Dict dict{ Entry("stale", Variant(1u)) };
        read(row.signature, row.value, dict, row.result, row.number);
        EXPECT_EQ(describe(dict), row.entries) << row.value;
    }
    Dict dict;  // a reply that takes many reads of the socket
    read("a{sv}", manyEntries(100000, R"(["u", 7])"), dict, 0);
    EXPECT_EQ(dict.size(), 100000u);
}

TEST_F(ARemoteObject, KeepsThePeersErrorNameAndTextWhetherTheCallBlockedOrWasPending) {
    ObjectPath path;
    for (bool pending : { false, true }) {
        ASSERT_EQ(peer->newMessage("Fail"), 0);
        EXPECT_EQ(pending ? peer->sendMessagePending() : peer->sendMessage(true, -1), pending ? 0 : -1);
        // A pending call stores the error reply, which reads as text where a path was expected.
        if (pending) EXPECT_EQ(peer->getReplyValue(path), -2);
        EXPECT_EQ(peer->getErrorNumber(), 11);
        EXPECT_EQ(peer->getErrorMessage(), "peer says no");
        EXPECT_EQ(peer->getErrorName(), "org.btbus.Error.Failed");
        peer->resetError();
        EXPECT_EQ(peer->getErrorName(), "");
    }
    ASSERT_EQ(peer->newMessage("NoSuchMethod"), 0);
    EXPECT_EQ(peer->sendMessage(true, -1), -1);
    EXPECT_NE(peer->getErrorMessage().find("NoSuchMethod"), std::string::npos) << peer->getErrorMessage();

    // A call given no method keeps the one being built.
    buildCall(*peer, "Echo", "kept");
    EXPECT_EQ(peer->newMessage(nullptr), -1);
    ASSERT_EQ(peer->sendMessage(true, -1), 0);
    EXPECT_EQ(replyText(*peer), "kept");
}

TEST_F(ARemoteObject, WritesEachArgumentWithTheTypeTheBusCarries) {
    const std::pair<Variant, const char*> kVariants[] = {
        { Variant(7u), "dbus.UInt32(7, variant_level=1)" },
        { Variant(static_cast<unsigned short>(5)), "dbus.UInt16(5, variant_level=1)" },
        { Variant(true), "dbus.Boolean(True, variant_level=1)" },
        { Variant(std::string("x")), "dbus.String('x', variant_level=1)" },
    };
    for (const auto& row : kVariants) {
        callPeer(*peer, "Describe", true, "text", ObjectPath("/a/b"), 4000000001u, static_cast<unsigned short>(65281),
                 row.first);
        EXPECT_EQ(replyText(*peer), std::string("dbus.Boolean(True), dbus.String('text'), dbus.ObjectPath('/a/b'), "
                                    "dbus.UInt32(4000000001), dbus.UInt16(65281), ") + row.second);
    }
}

TEST_F(ARemoteObject, GivesUpOnACallThatTimesOutOrIsInterruptedAndDropsItsLateReply) {
    buildCall(*peer, "Later", 1000u);
    EXPECT_EQ(peer->sendMessage(true, 200), -1);
    EXPECT_EQ(peer->getErrorNumber(), 11);
    EXPECT_NE(peer->getErrorMessage().find("reply"), std::string::npos) << peer->getErrorMessage();

    buildCall(*peer, "Later", 1500u);
    std::thread interrupter([] {
        std::this_thread::sleep_for(200ms);
        kill(getpid(), SIGINT);
    });
    EXPECT_EQ(peer->sendMessagePending(), 0);
    interrupter.join();
    EXPECT_FALSE(Bluetooth::internal::interruptedFlag());
    EXPECT_FALSE(Bluetooth::internal::replyArrivedFlag());
    std::string text;
    EXPECT_EQ(peer->getReplyValue(text), -1);
    EXPECT_EQ(peer->getErrorNumber(), 2);

    // Both late replies arrive during the next call.
    callPeer(*peer, "Later", 2000u);
    EXPECT_EQ(replyText(*peer), "2000");
}

}  // namespace
