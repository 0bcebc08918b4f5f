#include "bluez/signal_line.h"

#include <iostream>

namespace Bluetooth {
namespace internal {

namespace {

const char* pathOf(RemoteObject* proxy) { return proxy != 0 ? proxy->getPath() : 0; }

// What libstdc++ does for a null char pointer, without relying on it.
void put(const char* piece) {
    if (piece == 0)
        std::cout.setstate(std::ios_base::badbit);
    else
        std::cout << piece;
}

}  // namespace

void printLine(const SignalLine& line, RemoteObject* proxy) {
    put(line.lead);
    put(pathOf(proxy));
    put(line.tail);
    std::cout << std::endl;
}

void printLine(const SignalLine& line, const char* argument, RemoteObject* proxy,
               const char* extra) {
    put(line.lead);
    put(argument);
    put(line.link);
    put(pathOf(proxy));
    put(line.tail);
    put(extra);
    std::cout << std::endl;
}

void printLine(const SignalLine& line, const ObjectPath* argument, RemoteObject* proxy) {
    printLine(line, argument != 0 ? argument->c_str() : 0, proxy);
}

}  // namespace internal
}  // namespace Bluetooth
