// The vocabularies of phone connections: reply error codes, the "bytes" message tags of phone
// frames, step result names, the application a phone asks for and the service ids.
#pragma once

#include <string>
#include <string_view>

namespace kesu {

// The "error" of a connection reply to the PC suite; 0 (no case) means success.
enum class ErrorCode : int {
    UNKNOWN = -10000,
    STATE_BUSY = -10001,
    NOT_FOUND = -10002,
    BLE_COMM = -10003,
    REJECT = -10004,
    CANCEL = -10005,
    CREATE_GO_FAILED = -10006,
    TIMEOUT = -10007,
    IS_CANCELING = -10008,
    API_NOT_FOUND = -10009,
    CREATE_AP_FAIL = -10010,
    PC_CANCELING = -10013,
    PC_CONN_PHONE_BUSY = -10014,
    PC_CONN_PAD_BUSY = -10015,
};

// The message type of a phone frame: the one integer of its "bytes" array.
enum class ConnectTag : int {
    CONNECT = 0,
    PHONEAGREE = 1,
    PHONEREJECT = 2,
    AGREE = 3,
    REJECT = 4,
    BUSY = 11,
    DIFFDEVICEBUSY = 12,
    DEVICEINFOREQUEST = 22,
    DEVICEINFORESPONSE = 23,
    MOBILECONNECTPCREQUEST = 24,
    MOBILECONNECTPCRESPONSE = 25,
    PARSERMOBILEMSGFAILED = 26,
    MOBILECONNECTPCRESULT = 27,
    TIMEOUT = -1,  // local only: no answer was classified
};

// How a connection step ended; the raw value (the case name) is the key of the step's
// "result" object in the steps catalogue.
enum class Result {
    OK,
    FAILED,
    CANCEL,
    BLE_ERROR,
    STATE_ERROR,
    RECEIVER_EXTRACHARACTERISTICS_ERROR,
    CONFIGURATIONDESCRIPTOR_ERROR,
    REQUEST_CHARACTERISTICS_ERROR,
    MACISEMPTY,
    TIMEOUT,
    BUSY,
    REJECT,
    PHONECANCEL,
};

// The application a phone-initiated connection is for.
enum class AppSource : int { pcsuite = 1, kesuShare = 2 };

// The "service_id" values of phone messages.
enum class serviceId { pcsuiteId, shareId };

int rawValue(ErrorCode code);
int rawValue(ConnectTag tag);
std::string rawValue(Result result);
int rawValue(AppSource source);
std::string rawValue(serviceId id);  // "com.kesu.pcsuite.SERVICE", "com.kesu.share.CONNECT_PC"

}  // namespace kesu
