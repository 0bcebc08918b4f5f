// Shared by the fuzz targets: no bus within reach, a quiet log, and messages
// read from bytes in D-Bus's wire form, as they arrive from a peer.
#ifndef BTBUS_TESTS_FUZZ_FUZZ_H
#define BTBUS_TESTS_FUZZ_FUZZ_H

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include <dbus/dbus.h>

#include "core/log.h"

namespace fuzz {

// Before main, so before any object: buses that cannot be reached (a connection
// fails at once, never reaching the host's), and log lines that go nowhere.
static const bool kOffline = [] {
    setenv("DBUS_SYSTEM_BUS_ADDRESS", "unix:path=/nonexistent/btbus-fuzz", 1);
    setenv("DBUS_SESSION_BUS_ADDRESS", "unix:path=/nonexistent/btbus-fuzz", 1);
    Bluetooth::internal::setLogSink([](const char*) {});
    return true;
}();

// Gives use the message that data holds, if any. The body's length is taken from the
// input's size: a mutation elsewhere still reaches libdbus's checks and the decoders.
template <typename Use>
int withMessage(const uint8_t* data, size_t size, Use use) {
    if (size < 16 || size > (1u << 20) || (data[0] != 'l' && data[0] != 'B')) return 0;
    std::string bytes(reinterpret_cast<const char*>(data), size);
    // Its 32-bit words are in its own byte order, the one 'l' or 'B' names.
    bool swapped = (data[0] == 'l') != (__BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__);
    uint32_t word;
    memcpy(&word, &bytes[12], 4);
    size_t headerEnd = 16 + ((static_cast<size_t>(swapped ? __builtin_bswap32(word) : word) + 7) & ~size_t(7));
    if (headerEnd > size) return 0;
    word = static_cast<uint32_t>(size - headerEnd);
    if (swapped) word = __builtin_bswap32(word);
    memcpy(&bytes[4], &word, 4);
    DBusMessage* message = dbus_message_demarshal(bytes.data(), static_cast<int>(size), 0);
    if (message == 0) return 0;
    use(message);
    dbus_message_unref(message);
    return 0;
}

// A failed check: the fuzzer reports the input that made it.
inline void require(bool holds, const char* what) {
    if (holds) return;
    fprintf(stderr, "check failed: %s\n", what);
    abort();
}

}  // namespace fuzz

#endif
