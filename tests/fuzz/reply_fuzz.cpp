// A peer's reply, read in every way a proxy reads one.
#include <vector>

#include <bluetooth/remote_object.h>

#include "fuzz.h"

using namespace Bluetooth;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static RemoteObject reader("org.bluez", "/", "org.bluez.Adapter", DBUS_BUS_SYSTEM);
    return fuzz::withMessage(data, size, [](DBusMessage* message) {
        std::string text;
        bool truth = false;
        ObjectPath path;
        std::vector<std::string> texts;
        std::vector<ObjectPath> paths;
        Dict dict;
        for (int i = 0; i < 6; ++i) {
            reader.resetError();  // as every proxy operation begins
            reader.setReplyMessage(dbus_message_ref(message));
            int result = i == 0 ? reader.getReplyValue(text)  : i == 1 ? reader.getReplyValue(truth)
                       : i == 2 ? reader.getReplyValue(path)  : i == 3 ? reader.getReplyValue(texts)
                       : i == 4 ? reader.getReplyValue(paths) : reader.getReplyValue(dict);
            fuzz::require(result == 0 || result == -1 || (result == -2 && i == 2), "a result of 0, -1 or -2");
            fuzz::require((result == 0) == !reader.hasError(), "an error number exactly on failure");
            fuzz::require(reader.getReplyValue(text) == -1 && reader.getErrorNumber() == 2, "the reply read once");
        }
        for (const Entry& entry : dict) fuzz::require(entry.second.which() <= 5, "a known alternative");
    });
}
