// What happens to a phone's accepted connection request: the PC suite's busy check, the
// allow window and the user's answer, the answer to the phone, and the hand-over to the PC
// suite (an HTTP message, or starting the PC suite with the phone's details) or to the
// sharing application's window. The hand-over is a coroutine on the event loop; what blocks
// (HTTP to the PC suite, program launches) runs on the loop's worker pool, and the wait for
// the user's answer is a wake-up on the loop.
#pragma once

#include <asio/awaitable.hpp>

#include <atomic>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "core/ConnectCodes.h"
#include "connect/ConnectMessage.h"

namespace kesu {

class EventLoop;

class LaunchService {
public:
    // Sends the PC's answer with `tag` and service id to the phone; true when it left.
    using SendTcp = std::function<asio::awaitable<bool>(ConnectTag tag, serviceId id)>;

    explicit LaunchService(EventLoop& loop) : loop_(loop) {}

    // The whole hand-over of one request from the phone at `ip`, received on the PC's
    // address `localIp`, on the loop. Waits for the allow window (Config::allowWindowTimeout)
    // and (off the loop) for the exchanges with the PC suite.
    asio::awaitable<void> launchService(std::string ip, std::string localIp, AppSource appSource,
                                        PhoneConnectRequest request, SendTcp sendTcp);

    // On the loop: shows the PC suite's allow window (the launch runs on the worker pool) and
    // waits for the user's answer, at most Config::allowWindowTimeout, holding no thread: 0
    // when agreed, -1 when refused, unanswered in time or the window could not be started.
    // The sharing application has no such window: 0 at once.
    asio::awaitable<int> startAllowedWindow(AppSource appSource, std::string deviceName, std::string deviceId,
                                            std::string account, std::string openId, std::string deviceType);

    // Posts {"event": "nfcConection", "args": [nine texts]} to the PC suite's listener on the
    // PC's address `localIp`; true when it answered.
    bool sendPhoneInfoToPcsuite(const std::string& localIp, const std::string& ip, const std::string& deviceName,
                                const std::string& connectionMode, const std::string& deviceId, long long seqNo,
                                bool autoConnect, const std::string& account, const std::string& deviceType,
                                const std::string& openId);

    // Starts the PC suite with the phone's details as its nine arguments; true when started.
    bool startPcSuite(const std::string& ip, const std::string& deviceName, long long seqNo,
                      const std::string& connectionMode, const std::string& deviceId, bool autoConnect,
                      const std::string& account, const std::string& openId, const std::string& deviceType);

    // Shows the sharing application's window with its eight arguments; no answer is awaited.
    bool startKesuShareAllowedWindow(const std::string& deviceName, const std::string& deviceId,
                                     const std::string& ip, const std::string& openId, long long seqNo,
                                     const std::string& port);

    // The argument lists of the launched programs (for the launches and their tests).
    static std::vector<std::string> allowWindowArguments(AppSource appSource, const std::string& deviceName,
                                                         const std::string& deviceId, const std::string& account,
                                                         const std::string& sameAccount,
                                                         const std::string& deviceType);
    static std::vector<std::string> pcSuiteArguments(const std::string& ip, const std::string& deviceName,
                                                     long long seqNo, const std::string& connectionMode,
                                                     const std::string& deviceId, bool autoConnect,
                                                     const std::string& account, const std::string& deviceType,
                                                     const std::string& sameAccount);

    // Ends every wait for an allow-window answer at once (as a refusal), now and until
    // resume() is called. Used when the server stops.
    void stopWaits();
    void resume();

private:
    EventLoop& loop_;

    // The receive folders handed to the sharing window: the account's current one and the
    // one before it.
    std::pair<std::string, std::string> receiveFolders();

    std::mutex folderMutex_;
    bool folderKnown_ = false;
    std::string currentFolder_;
    std::string previousFolder_;

    std::mutex waitMutex_;
    bool stopped_ = false;  // stopWaits() was called
};

}  // namespace kesu
