// One process-wide flag: whether the user cancelled the PC-initiated ("primary") connection.
// The dispatcher and the connect flow set it; the connect flow tests it between its steps.
#pragma once

#include <atomic>

namespace kesu {

class StateCheck {
public:
    static StateCheck& instance();

    void setPrimaryConnectCancel(bool isPrimaryConnectCancel);
    bool checkPrimaryConnectCancel() const;

private:
    std::atomic<bool> isPrimaryConnectCancel_{false};
};

}  // namespace kesu
