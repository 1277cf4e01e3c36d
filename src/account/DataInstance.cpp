// The process-wide account record.
#include "account/DataInstance.h"

namespace kesu {

SharedDatabaseParam& dataInstance() {
    // Created on first use and never destroyed, so detached threads can always reach it.
    static SharedDatabaseParam* instance = new SharedDatabaseParam();
    return *instance;
}

}  // namespace kesu
