#ifndef BTBUS_SRC_BLUEZ_SIGNAL_LINE_H
#define BTBUS_SRC_BLUEZ_SIGNAL_LINE_H

#include <bluetooth/remote_object.h>

namespace Bluetooth {
namespace internal {

// A signal of a proxy class and the line its default handler prints:
//   lead, [argument, link,] the proxy's path, tail, [extra], newline.
struct SignalLine {
    const char* signal;
    const char* lead;
    const char* link;
    const char* tail;
};

// Argument-less signals: lead, path, tail. Writes one line to standard output
// and flushes it. A null piece (argument, proxy, extra) fails the stream as
// inserting a null character pointer does, and the rest of the line is lost:
// accepted, and kept that way on purpose.
void printLine(const SignalLine& line, RemoteObject* proxy);
// Signals with an argument: lead, argument, link, path, tail, extra.
void printLine(const SignalLine& line, const char* argument, RemoteObject* proxy,
               const char* extra = "");
// Signals with an object path as argument.
void printLine(const SignalLine& line, const ObjectPath* argument, RemoteObject* proxy);

}  // namespace internal
}  // namespace Bluetooth

#endif
