// Shared by the fuzz targets: no bus within reach, a quiet log, and messages
// read from bytes in D-Bus's wire form, as they arrive from a peer.
#ifndef BTBUS_TESTS_FUZZ_FUZZ_H
#define BTBUS_TESTS_FUZZ_FUZZ_H

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include <dbus/dbus.h>

#include "core/log.h"

namespace fuzz {

inline void quiet(const char*) {}

// Once, before any object: buses that cannot be reached (a connection fails
// at once, and never reaches the host's), and log lines that go nowhere.
inline bool offline() {
    setenv("DBUS_SYSTEM_BUS_ADDRESS", "unix:path=/nonexistent/btbus-fuzz", 1);
    setenv("DBUS_SESSION_BUS_ADDRESS", "unix:path=/nonexistent/btbus-fuzz", 1);
    Bluetooth::internal::setLogSink(&quiet);
    return true;
}

// A 32-bit word of a message in its own byte order ('l' or 'B' at its start).
inline uint32_t word(const std::string& bytes, size_t at) {
    uint32_t value;
    memcpy(&value, &bytes[at], 4);
    bool little = bytes[0] == 'l';
    return little == (__BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__) ? value : __builtin_bswap32(value);
}

inline void setWord(std::string& bytes, size_t at, uint32_t value) {
    if ((bytes[0] == 'l') != (__BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__)) value = __builtin_bswap32(value);
    memcpy(&bytes[at], &value, 4);
}

// The message that data holds, or null; the caller unrefs it. The body's
// length is taken from the input's size, so that a mutation elsewhere still
// reaches libdbus's checks of the content and the decoders behind them.
inline DBusMessage* demarshal(const uint8_t* data, size_t size) {
    if (size < 16 || size > (1u << 20) || (data[0] != 'l' && data[0] != 'B')) return 0;
    std::string bytes(reinterpret_cast<const char*>(data), size);
    size_t headerEnd = 16 + ((static_cast<size_t>(word(bytes, 12)) + 7) & ~static_cast<size_t>(7));
    if (headerEnd > size) return 0;
    setWord(bytes, 4, static_cast<uint32_t>(size - headerEnd));
    return dbus_message_demarshal(bytes.data(), static_cast<int>(size), 0);
}

// A failed check: the fuzzer reports the input that made it.
inline void require(bool holds, const char* what) {
    if (!holds) {
        fprintf(stderr, "check failed: %s\n", what);
        abort();
    }
}

}  // namespace fuzz

#endif
