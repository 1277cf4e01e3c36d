#include "pcsuite/BuryPoint.h"

#include "core/WallClock.h"


namespace kesu {

namespace {

BuryPoint::Record toRecord(const Json& j) {
    return BuryPoint::Record::parse(json::compact(j), nullptr, /*allow_exceptions=*/false);
}

}  // namespace

BuryPoint::Record BuryPoint::listRecord(const std::string& eventId, const Json& params, const Json& extra) {
    Record record = Record::object();
    record["type"] = 1;
    record["eventId"] = eventId;
    record["params"] = params.is_object() ? toRecord(params) : Record::object();
    if (extra.is_object())
        for (auto it = extra.begin(); it != extra.end(); ++it) record[it.key()] = toRecord(*it);
    return record;
}

std::string BuryPoint::listText(const Record& record, bool pretty) {
    const std::string text = pretty ? record.dump(2, ' ', false, Record::error_handler_t::replace)
                                    : record.dump(-1, ' ', false, Record::error_handler_t::replace);
    return "[" + text + "]";
}

BuryPoint::Record BuryPoint::datagramRecord(const std::string& eventId, Record value) {
    Record record;
    record["pType"] = 0;
    record["eventID"] = eventId;
    record["value"] = std::move(value);
    record["isDayReport"] = 0;
    record["createTime"] = static_cast<long long>(WallClock::currentTimeStamp() * 1000);
    return record;
}

}  // namespace kesu
