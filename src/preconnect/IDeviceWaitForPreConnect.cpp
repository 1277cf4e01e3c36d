#include "preconnect/IDeviceWaitForPreConnect.h"

namespace kesu {

asio::awaitable<bool> IDeviceWaitForPreConnect::startPreConnect() { co_return false; }

}  // namespace kesu
