#include <bluetooth/version.h>

namespace Bluetooth {

const char* version() { return BTBUS_VERSION; }

}  // namespace Bluetooth
