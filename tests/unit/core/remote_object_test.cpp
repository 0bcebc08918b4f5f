// The client core without a bus: both bus addresses point at nothing, so every
// object has a null connection. Messages are built in memory.
#include <gtest/gtest.h>

#include <bluetooth/connection.h>
#include <bluetooth/remote_object.h>

#include "support/log_capture.h"

using namespace Bluetooth;
using btbus_test::LogCapture;

namespace {

// Reaches the protected state that the tests need to set up or inspect.
class Probe : public RemoteObject {
public:
    Probe() : RemoteObject("org.bluez", "/", "org.bluez.Manager", DBUS_BUS_SYSTEM) {}
    void setError(int number, const std::string& text) {
        errorNumber = number;
        errorMessage = text;
    }
    DBusMessage* outgoing() const { return message; }
};

DBusMessage* methodReturn() {
    DBusMessage* call = dbus_message_new_method_call("org.bluez", "/", "org.bluez.Manager", "Get");
    dbus_message_set_serial(call, 1);
    DBusMessage* reply = dbus_message_new_method_return(call);
    dbus_message_unref(call);
    return reply;
}

// Whether an operation gave -1 and left error number in object.
testing::AssertionResult refused(const RemoteObject& object, int result, int number) {
    if (result == -1 && object.getErrorNumber() == number) return testing::AssertionSuccess();
    return testing::AssertionFailure() << "result " << result << ", error " << object.getErrorNumber();
}

TEST(ARemoteObjectWithoutABus, LogsOnceAndFailsEveryCallThroughTheErrorState) {
    LogCapture log;
    Probe object;
    EXPECT_EQ(object.getConnection(), nullptr);
    EXPECT_EQ(log.countEndingWith(" Failed to get bus connection"), 1u);
    EXPECT_EQ(log.lines().at(0).rfind("connection.cpp:", 0), 0u);
    EXPECT_STREQ(object.getConnectionName(), "");

    ASSERT_EQ(object.newMessage("ListAdapters"), 0);
    EXPECT_TRUE(refused(object, object.sendMessage(false, -1), 10));
    ASSERT_EQ(object.newMessage("ListAdapters"), 0);
    EXPECT_TRUE(refused(object, object.sendMessage(true, -1), 11));
    EXPECT_EQ(object.getErrorMessage(), "No connection to the bus");
    object.resetError();
    ASSERT_EQ(object.newMessage("CreatePairedDevice"), 0);
    EXPECT_TRUE(refused(object, object.sendMessagePending(), 11));

    log.clear();
    EXPECT_EQ(object.setSignalHandlerString("DeviceDisappeared", [](RemoteObject*, const char*) {}), -1);
    EXPECT_EQ(log.countEndingWith(" Match error (no connection to the bus)"), 1u);
    EXPECT_TRUE(RemoteObject::signalHandlerVectorString.empty());
}

TEST(ARemoteObject, GivesTheFixedTextOfEachErrorNumber) {
    const char* texts[] = { "Parameter is null",       "Reply message is null",
                            "Invalid path",            "Invalid reply value",
                            "Invalid reply format",    "Failed to create message",
                            "Failed to append args to message", "Failed to append args = iterator",
                            "Failed to open container", "Failed to send message" };
    Probe object;
    for (int number = 1; number <= 10; ++number) {
        object.setError(number, "stale");
        EXPECT_EQ(object.getErrorMessage(), texts[number - 1]);
    }
    object.setError(11, "the peer's own words");
    EXPECT_EQ(object.getErrorMessage(), "the peer's own words");
    object.setError(42, "stale");
    EXPECT_EQ(object.getErrorMessage(), "Unknown error");
    object.setError(0, "kept");
    EXPECT_EQ(object.getErrorMessage(), "kept");
    EXPECT_FALSE(object.hasError());
    object.setError(-3, "");
    EXPECT_TRUE(object.hasError());
    EXPECT_EQ(object.getErrorMessage(), "Unknown error");
    object.resetError();
    EXPECT_EQ(object.getErrorNumber(), 0);
    EXPECT_EQ(object.getErrorMessage(), "");
}

TEST(ARemoteObject, DescribesItselfInThreeLines) {
    Probe object;
    EXPECT_EQ(object.getInfo(), "RemoteObject name: org.bluez\nPath: /\nInterface: org.bluez.Manager\n");
    testing::internal::CaptureStdout();
    EXPECT_EQ(object.printInfo(), 0);
    EXPECT_EQ(testing::internal::GetCapturedStdout(), object.getInfo());
}

TEST(ARemoteObject, RefusesArgumentsThatCannotBeWritten) {
    Probe object;
    EXPECT_TRUE(refused(object, object.newMessage(nullptr), 1));
    EXPECT_TRUE(refused(object, object.newMessage("not a member!"), 6));
    // Appending before any call was built fails instead of crashing.
    EXPECT_TRUE(refused(object, object.append(true), 7));
    EXPECT_TRUE(refused(object, object.append(Variant(1u)), 9));

    ASSERT_EQ(object.newMessage("SetProperty"), 0);
    EXPECT_TRUE(refused(object, object.append(static_cast<const char*>(nullptr)), 1));
    EXPECT_TRUE(refused(object, object.append(ObjectPath("org/bluez")), 3));
    EXPECT_TRUE(refused(object, object.append(ObjectPath()), 3));
    EXPECT_TRUE(refused(object, object.append(ObjectPath("/a//b")), 7));
    EXPECT_TRUE(refused(object, object.append("\xff\xfe not text"), 7));
    EXPECT_TRUE(refused(object, object.append(Variant(std::vector<std::string>{ "a" })), 9));
    EXPECT_TRUE(refused(object, object.append(Variant(-5)), 9));
    EXPECT_TRUE(refused(object, object.append(Variant(std::string("\xc3"))), 8));
    // None of the failures left anything in the call.
    EXPECT_STREQ(dbus_message_get_signature(object.outgoing()), "");
}

TEST(ARemoteObject, WritesEachWritableAlternativeAsAVariant) {
    Probe object;
    ASSERT_EQ(object.newMessage("SetProperty"), 0);
    ASSERT_EQ(object.append("Name"), 0);
    ASSERT_EQ(object.append(Variant(static_cast<unsigned short>(5))), 0);
    ASSERT_EQ(object.append(Variant(7u)), 0);
    ASSERT_EQ(object.append(Variant(true)), 0);
    ASSERT_EQ(object.append(Variant(std::string("x"))), 0);
    EXPECT_STREQ(dbus_message_get_signature(object.outgoing()), "svvvv");

    // Reading them back gives the same values.
    DBusMessageIter arguments;
    dbus_message_iter_init(object.outgoing(), &arguments);
    dbus_message_iter_next(&arguments);
    Entry entry;
    const Variant expected[] = { Variant(static_cast<unsigned short>(5)), Variant(7u), Variant(true),
                                 Variant(std::string("x")) };
    for (const Variant& value : expected) {
        ASSERT_EQ(object.parseEntryValue(arguments, entry), 0);
        EXPECT_TRUE(entry.second == value);
        dbus_message_iter_next(&arguments);
    }
}

TEST(ARemoteObject, ReadsEntryNamesFromStringsAndUnsignedNumbersOnly) {
    Probe object;
    DBusMessage* reply = methodReturn();
    const char* name = "Alias";
    dbus_uint32_t handle = 65537;
    dbus_int32_t signedNumber = 7;
    dbus_message_append_args(reply, DBUS_TYPE_STRING, &name, DBUS_TYPE_UINT32, &handle, DBUS_TYPE_INT32,
                             &signedNumber, DBUS_TYPE_INVALID);
    DBusMessageIter arguments;
    dbus_message_iter_init(reply, &arguments);
    Entry entry;
    EXPECT_EQ(object.parseEntryName(arguments, entry), 0);
    EXPECT_EQ(entry.first, "Alias");
    dbus_message_iter_next(&arguments);
    EXPECT_EQ(object.parseEntryName(arguments, entry), 0);
    EXPECT_EQ(entry.first, "65537");
    dbus_message_iter_next(&arguments);
    EXPECT_TRUE(refused(object, object.parseEntryName(arguments, entry), 4));
    // A bare string is a value too; a bare number is not.
    dbus_message_iter_init(reply, &arguments);
    EXPECT_EQ(object.parseEntryValue(arguments, entry), 0);
    EXPECT_TRUE(entry.second == Variant(std::string("Alias")));
    dbus_message_iter_next(&arguments);
    EXPECT_EQ(object.parseEntryValue(arguments, entry), -1);
    dbus_message_unref(reply);
}

TEST(ARemoteObject, OwnsTheReplyItIsGivenUntilItIsRead) {
    Probe object;
    EXPECT_TRUE(refused(object, object.setReplyMessage(nullptr), 2));
    DBusMessage* reply = methodReturn();
    dbus_int16_t rssi = -5;
    dbus_message_append_args(reply, DBUS_TYPE_INT16, &rssi, DBUS_TYPE_INVALID);
    ASSERT_EQ(object.setReplyMessage(reply), 0);
    ASSERT_EQ(object.setReplyMessage(methodReturn()), 0);  // the first one is released
    std::vector<std::string> values;
    EXPECT_TRUE(refused(object, object.getReplyValue(values), 4));  // an empty reply is not an array
    EXPECT_TRUE(refused(object, object.getReplyValue(values), 2));
}

TEST(AnObjectPath, HoldsItsTextAndIsNeverNull) {
    ObjectPath empty;
    EXPECT_STREQ(static_cast<const char*>(empty), "");
    EXPECT_EQ(empty.str(), "");
    ObjectPath path("/org/bluez/hci0");
    ObjectPath copy;
    copy = path;
    EXPECT_STREQ(copy.c_str(), "/org/bluez/hci0");
    EXPECT_EQ(static_cast<std::string>(ObjectPath(std::string("/x"))), "/x");
}

TEST(AVariant, CopiesItsListByValue) {
    Variant original(std::vector<std::string>{ "a", "b" });
    Variant copy = original;
    boost::get<std::vector<std::string>>(copy).push_back("c");
    EXPECT_EQ(boost::get<std::vector<std::string>>(original).size(), 2u);
    EXPECT_EQ(Variant().which(), 0);
    EXPECT_EQ(boost::get<unsigned int>(Variant()), 0u);
}

// ---- dispatchers, fed with signals built in memory ----

std::vector<std::string> gCalls;

DBusMessage* signal(const char* member) {
    return dbus_message_new_signal("/org/bluez/1/hci0", "org.bluez.Manager", member);
}

TEST(TheDispatchers, CallMatchingHandlersInRegistrationOrderAndStopAtAFailure) {
    Probe a;
    Probe b;
    LogCapture log;
    gCalls.clear();
    auto& paths = RemoteObject::signalHandlerVectorObjectPath;
    paths.push_back(SignalHandler<SignalFunctionObjectPath>(&a, "AdapterAdded", [](RemoteObject* o, const ObjectPath* p) {
        gCalls.push_back(std::string("a ") + o->getPath() + " " + p->c_str());
    }));
    paths.push_back(SignalHandler<SignalFunctionObjectPath>(&b, "AdapterRemoved", [](RemoteObject*, const ObjectPath*) {
        gCalls.push_back("b");
    }));
    paths.push_back(SignalHandler<SignalFunctionObjectPath>(&b, "AdapterAdded", [](RemoteObject*, const ObjectPath* p) {
        gCalls.push_back(std::string("b ") + p->c_str());
    }));

    DBusMessage* added = signal("AdapterAdded");
    const char* path = "/org/bluez/1/hci1";
    dbus_message_append_args(added, DBUS_TYPE_OBJECT_PATH, &path, DBUS_TYPE_INVALID);
    RemoteObject::signalHandlerDispatcherObjectPath(&a, added);
    EXPECT_EQ(gCalls, (std::vector<std::string>{ "a / /org/bluez/1/hci1", "b /org/bluez/1/hci1" }));

    gCalls.clear();
    DBusMessage* wrong = signal("AdapterAdded");
    dbus_message_append_args(wrong, DBUS_TYPE_STRING, &path, DBUS_TYPE_INVALID);
    RemoteObject::signalHandlerDispatcherObjectPath(&a, wrong);
    EXPECT_TRUE(gCalls.empty());
    EXPECT_EQ(log.countEndingWith(" Argument is not object path"), 1u);

    dbus_message_unref(added);
    dbus_message_unref(wrong);
}

TEST(TheDispatchers, GiveArgumentlessHandlersTheDispatchingObject) {
    Probe registering;
    Probe dispatching;
    static RemoteObject* seen = nullptr;
    RemoteObject::signalHandlerVectorNoArgument.push_back(
        SignalHandler<SignalFunctionNoArgument>(&registering, "Playing", [](RemoteObject* o) { seen = o; }));
    DBusMessage* playing = signal("Playing");
    RemoteObject::signalHandlerDispatcherNoArgument(&dispatching, playing);
    EXPECT_EQ(seen, &dispatching);
    dbus_message_unref(playing);
}

}  // namespace
