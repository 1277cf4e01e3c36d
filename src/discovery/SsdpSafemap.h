// The lock-guarded table of discovered devices: device id -> latest record. Entries not
// heard for longer than the expiry go at the next sweep. The table is bounded: when a new
// id arrives at a full table, the entry heard longest ago makes room for it. Ages are kept
// on a monotonic clock, so a step of the wall clock neither expires live devices nor keeps
// silent ones.
#pragma once

#include <cstddef>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "core/SteadyClock.h"
#include "discovery/SsdpDevice.h"

namespace kesu {

class SsdpSafemap {
public:
    // Bound and expiry from Config::current() (ssdpMaxDevices, ssdpDeviceExpiry).
    SsdpSafemap();
    // `clock` (which must outlive the table) stamps every store and drives the sweep.
    SsdpSafemap(std::size_t maxDevices, double expirySeconds, const SteadyClock& clock = SteadyClock::system());

    // Stores the record under the key, replacing any present one (`cover` changes nothing
    // visible), heard now. A new key in a full table evicts the entry heard longest ago.
    // Always true, except for a null record, which is not stored (false).
    bool insert(const std::string& opKey, SsdpDevicePtr opValue, bool cover = false);
    // True and the stored record in `opValue` when present; `opValue` untouched otherwise.
    bool lookup(const std::string& opKey, SsdpDevicePtr& opValue) const;
    // Replaces a present record, heard now (true); stores nothing for an absent key (false).
    bool update(const std::string& opKey, SsdpDevicePtr opValue);
    // All stored records, in no particular order.
    std::vector<SsdpDevicePtr> getDevicesArray() const;
    // Removes every entry not heard for longer than the expiry (an entry exactly at the
    // expiry stays); true when at least one went.
    bool eraseTimeOut();
    // How long an entry stays after it was last heard.
    SteadyClock::duration expiry() const { return expiry_; }
    // When the entry heard longest ago passes the expiry (the next sweep that removes
    // something); nullopt for an empty table.
    std::optional<SteadyClock::time_point> nextExpiry() const;
    // Removes every entry.
    void clear();

    std::size_t size() const;
    std::size_t maxDevices() const { return maxDevices_; }
    // Entries evicted so far to keep the bound.
    std::size_t evictedCount() const;

private:
    struct Entry {
        SsdpDevicePtr device;
        SteadyClock::time_point heard;
    };
    using Entries = std::map<std::string, Entry>;

    void storeLocked(const std::string& key, SsdpDevicePtr value);
    void eraseLocked(Entries::iterator it);

    const std::size_t maxDevices_;
    const SteadyClock::duration expiry_;
    const SteadyClock& clock_;

    mutable std::mutex lock;
    Entries safeMap;
    // (heard, key) of every entry, oldest first: drives eviction and the sweep.
    std::set<std::pair<SteadyClock::time_point, std::string>> byAge_;
    std::size_t evicted_ = 0;
    bool evictionLogged_ = false;  // one log line per stretch of time at the bound
};

}  // namespace kesu
