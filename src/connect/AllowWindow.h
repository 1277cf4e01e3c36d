// The hand-over of the user's answer in the allow window of a phone-initiated connection:
// the control API signals it, the waiting connection handler takes it.
#pragma once

#include <semaphore>

namespace kesu {

// Signalled once per answer (QtAgree / QtRefuse).
std::counting_semaphore<>& hAllowSemaphore();

}  // namespace kesu
