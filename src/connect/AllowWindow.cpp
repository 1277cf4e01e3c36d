#include "connect/AllowWindow.h"

namespace kesu {

std::counting_semaphore<>& hAllowSemaphore() {
    static auto* semaphore = new std::counting_semaphore<>(0);
    return *semaphore;
}

}  // namespace kesu
