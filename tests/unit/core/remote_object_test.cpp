// The client core without a bus: both bus addresses point at nothing, so every
// object has a null connection. Messages are built in memory.
#include <gtest/gtest.h>

#include <bluetooth/remote_object.h>

#include "support/log_capture.h"

using namespace Bluetooth;
using btbus_test::LogCapture;

namespace {

// Reaches the protected state that the tests need to set up or inspect.
class Probe : public RemoteObject {
public:
    Probe() : RemoteObject("org.bluez", "/", "org.bluez.Manager", DBUS_BUS_SYSTEM) {}
    void setError(int number, const std::string& text) { errorNumber = number; errorMessage = text; }
    DBusMessage* outgoing() const { return message; }
};

// Whether an operation gave -1 and left error number in object.
testing::AssertionResult refused(const RemoteObject& object, int result, int number) {
    if (result == -1 && object.getErrorNumber() == number) return testing::AssertionSuccess();
    return testing::AssertionFailure() << "result " << result << ", error " << object.getErrorNumber();
}

TEST(ARemoteObjectWithoutABus, LogsOnceAndFailsEveryCallThroughTheErrorState) {
    LogCapture log;
    Probe object;
    EXPECT_EQ(object.getConnection(), nullptr);
    EXPECT_EQ(log.from("connection.cpp"), std::vector<std::string>{ "Failed to get bus connection" });
    EXPECT_STREQ(object.getConnectionName(), "");

    // As a blocking call does (11); the proxies' tests show one-way (10) and blocking calls.
    ASSERT_EQ(object.newMessage("CreatePairedDevice"), 0);
    EXPECT_TRUE(refused(object, object.sendMessagePending(), 11));
    EXPECT_EQ(object.getErrorMessage(), "No connection to the bus");

    log.clear();
    EXPECT_EQ(object.setSignalHandlerString("DeviceDisappeared", [](RemoteObject*, const char*) {}), -1);
    EXPECT_EQ(log.countEndingWith(" Match error (no connection to the bus)"), 1u);
    EXPECT_TRUE(RemoteObject::signalHandlerVectorString.empty());
}

TEST(ARemoteObject, GivesTheFixedTextOfEachErrorNumberButTheStoredOneForNoneAndForABusError) {
    const char* const texts[] = { "stale", "Parameter is null", "Reply message is null", "Invalid path",
                                  "Invalid reply value", "Invalid reply format", "Failed to create message",
                                  "Failed to append args to message", "Failed to append args = iterator",
                                  "Failed to open container", "Failed to send message", "stale" };
    Probe object;
    for (int number = -1; number <= 12; ++number) {
        object.setError(number, "stale");
        EXPECT_EQ(object.getErrorMessage(), number >= 0 && number <= 11 ? texts[number] : "Unknown error") << number;
        EXPECT_EQ(object.hasError(), number != 0);
    }
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
    EXPECT_TRUE(refused(object, object.newMessage("not a member!"), 6));
    // Appending before any call was built fails instead of crashing.
    EXPECT_TRUE(refused(object, object.append(true), 7));
    EXPECT_TRUE(refused(object, object.append(Variant(1u)), 9));

    ASSERT_EQ(object.newMessage("SetProperty"), 0);
    EXPECT_TRUE(refused(object, object.append(ObjectPath("org/bluez")), 3));
    EXPECT_TRUE(refused(object, object.append(ObjectPath("/a//b")), 7));
    EXPECT_TRUE(refused(object, object.append("\xff\xfe not text"), 7));
    EXPECT_TRUE(refused(object, object.append(Variant(std::vector<std::string>{ "a" })), 9));
    EXPECT_TRUE(refused(object, object.append(Variant(-5)), 9));
    EXPECT_TRUE(refused(object, object.append(Variant(std::string("\xc3"))), 8));
    // None of the failures left anything in the call.
    EXPECT_STREQ(dbus_message_get_signature(object.outgoing()), "");
}

TEST(ARemoteObject, ReadsAnEntryNameFromAStringAndAValueFromAStringButNotFromABareNumber) {
    Probe object;
    DBusMessage* values = dbus_message_new(DBUS_MESSAGE_TYPE_METHOD_RETURN);
    const char* name = "Alias";
    dbus_int32_t number = 7;
    dbus_message_append_args(values, DBUS_TYPE_STRING, &name, DBUS_TYPE_INT32, &number, DBUS_TYPE_INVALID);
    DBusMessageIter arguments;
    dbus_message_iter_init(values, &arguments);
    Entry entry;
    EXPECT_EQ(object.parseEntryName(arguments, entry), 0);
    EXPECT_EQ(object.parseEntryValue(arguments, entry), 0);  // from the same argument: neither advances
    EXPECT_TRUE(entry == Entry("Alias", Variant(std::string("Alias"))));
    dbus_message_iter_next(&arguments);
    EXPECT_TRUE(refused(object, object.parseEntryName(arguments, entry), 4));
    EXPECT_TRUE(refused(object, object.parseEntryValue(arguments, entry), 4));
    dbus_message_unref(values);
}

TEST(ARemoteObject, RefusesANullReplyAndReadsTheLastOneItWasGiven) {
    Probe object;
    EXPECT_TRUE(refused(object, object.setReplyMessage(nullptr), 2));
    std::string text;
    ASSERT_EQ(object.setReplyMessage(dbus_message_new(DBUS_MESSAGE_TYPE_METHOD_RETURN)), 0);
    EXPECT_TRUE(refused(object, object.getReplyValue(text), 4));  // an empty reply holds no value
    DBusMessage* last = dbus_message_new(DBUS_MESSAGE_TYPE_METHOD_RETURN);
    const char* kept = "kept";
    dbus_message_append_args(last, DBUS_TYPE_STRING, &kept, DBUS_TYPE_INVALID);
    ASSERT_EQ(object.setReplyMessage(dbus_message_new(DBUS_MESSAGE_TYPE_METHOD_RETURN)), 0);
    ASSERT_EQ(object.setReplyMessage(last), 0);  // the one before is released
    EXPECT_EQ(object.getReplyValue(text), 0);
    EXPECT_EQ(text, "kept");
}

TEST(TheDispatchers, CallTheMembersHandlersInRegistrationOrder) {
    Probe first, second;
    static std::vector<RemoteObject*> called;
    SignalFunctionObjectPath note = [](RemoteObject* object, const ObjectPath*) { called.push_back(object); };
    RemoteObject::signalHandlerVectorObjectPath.push_back({ &second, "AdapterAdded", note });
    RemoteObject::signalHandlerVectorObjectPath.push_back({ &first, "AdapterRemoved", note });
    RemoteObject::signalHandlerVectorObjectPath.push_back({ &first, "AdapterAdded", note });
    DBusMessage* added = dbus_message_new_signal("/org/bluez/1/hci0", "org.bluez.Manager", "AdapterAdded");
    const char* path = "/org/bluez/1/hci1";
    dbus_message_append_args(added, DBUS_TYPE_OBJECT_PATH, &path, DBUS_TYPE_INVALID);
    RemoteObject::signalHandlerDispatcherObjectPath(&first, added);
    EXPECT_EQ(called, (std::vector<RemoteObject*>{ &second, &first }));
    dbus_message_unref(added);
}

}  // namespace
