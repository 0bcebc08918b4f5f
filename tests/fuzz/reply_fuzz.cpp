// A peer's reply, read in every way a proxy reads one.
#include <functional>
#include <vector>

#include <bluetooth/remote_object.h>

#include "fuzz.h"

using namespace Bluetooth;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static bool ready = fuzz::offline();
    static RemoteObject reader("org.bluez", "/", "org.bluez.Adapter", DBUS_BUS_SYSTEM);
    (void)ready;
    DBusMessage* message = fuzz::demarshal(data, size);
    if (message == 0) return 0;
    std::string text;
    bool truth = false;
    ObjectPath path;
    std::vector<std::string> texts;
    std::vector<ObjectPath> paths;
    Dict dict;
    const std::vector<std::function<int()> > reads = {
        [&] { return reader.getReplyValue(text); },  [&] { return reader.getReplyValue(truth); },
        [&] { return reader.getReplyValue(path); },  [&] { return reader.getReplyValue(texts); },
        [&] { return reader.getReplyValue(paths); }, [&] { return reader.getReplyValue(dict); },
    };
    for (size_t i = 0; i < reads.size(); ++i) {
        reader.resetError();  // as every proxy operation begins
        reader.setReplyMessage(dbus_message_ref(message));
        int result = reads[i]();
        fuzz::require(result == 0 || result == -1 || (result == -2 && i == 2), "a result of 0, -1 or -2");
        fuzz::require((result == 0) == !reader.hasError(), "an error number exactly on failure");
        fuzz::require(reader.getReplyValue(text) == -1 && reader.getErrorNumber() == 2, "the reply read once");
    }
    for (const Entry& entry : dict) fuzz::require(entry.second.which() <= 5, "a known alternative");
    dbus_message_unref(message);
    return 0;
}
