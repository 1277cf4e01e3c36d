#include "discovery/StateCheck.h"

namespace kesu {

StateCheck& StateCheck::instance() {
    static StateCheck* check = new StateCheck();
    return *check;
}

void StateCheck::setPrimaryConnectCancel(bool isPrimaryConnectCancel) {
    isPrimaryConnectCancel_.store(isPrimaryConnectCancel);
}

bool StateCheck::checkPrimaryConnectCancel() const { return isPrimaryConnectCancel_.load(); }

}  // namespace kesu
