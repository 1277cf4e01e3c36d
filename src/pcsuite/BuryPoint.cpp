#include "pcsuite/BuryPoint.h"

#include "connect/UdpSocketBase.h"
#include "core/Config.h"
#include "core/Utils.h"

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

BuryPoint::Record BuryPoint::flatRecord(const std::string& eventId, const Json& value) {
    Record record = Record::object();
    record["pType"] = 0;
    record["eventID"] = eventId;
    record["value"] = value.is_object() ? toRecord(value) : Record::object();
    record["isDayReport"] = 0;
    record["createTime"] = static_cast<long long>(Utils::currentTimeStamp() * 1000);
    return record;
}

bool BuryPoint::sendFlat(const Record& record) {
    const std::string text = record.dump(-1, ' ', false, Record::error_handler_t::replace);
    const Config& config = Config::current();
    UdpSocketBase socket;
    if (!socket.initial(static_cast<std::uint16_t>(config.buryPointUdpPort), config.buryPointUdpHost, -1)) return false;
    return socket.sendMsg(3.0, Bytes(text.begin(), text.end()));
}

}  // namespace kesu
