// The shared record of the signed-in account, the PC and the last connected devices,
// filled from the PC suite's files and requests and read by nearly every subsystem.
#pragma once

#include <mutex>
#include <string>

namespace kesu {

struct databaseParam {
    std::string openid;
    std::string Phone;  // masked
    std::string token;
    std::string lastToken;
    std::string lastOpenId;
    std::string clientId;
    std::string pcDeviceId;
    std::string version;
    std::string configDir;
    std::string storageDir;
    std::string historyPhoneId;
    std::string historyPadId;
};

// Guards the record: readers take whole copies or single fields, never a torn string.
class SharedDatabaseParam {
public:
    databaseParam get() const {
        std::lock_guard<std::mutex> lock(mutex_);
        return param_;
    }
    std::string get(std::string databaseParam::*field) const {
        std::lock_guard<std::mutex> lock(mutex_);
        return param_.*field;
    }
    void set(std::string databaseParam::*field, std::string value) {
        std::lock_guard<std::mutex> lock(mutex_);
        param_.*field = std::move(value);
    }
    // Changes several fields at once, atomically for readers.
    template <class F>
    void update(F&& change) {
        std::lock_guard<std::mutex> lock(mutex_);
        change(param_);
    }

private:
    mutable std::mutex mutex_;
    databaseParam param_;
};

// The process-wide record.
SharedDatabaseParam& dataInstance();

}  // namespace kesu
