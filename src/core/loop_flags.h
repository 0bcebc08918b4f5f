#ifndef BTBUS_SRC_CORE_LOOP_FLAGS_H
#define BTBUS_SRC_CORE_LOOP_FLAGS_H

namespace Bluetooth {
namespace internal {

// The process-wide flags of a pending call's wait, for tests that check they
// are cleared when the wait ends.
bool interruptedFlag();
bool replyArrivedFlag();

}  // namespace internal
}  // namespace Bluetooth

#endif
