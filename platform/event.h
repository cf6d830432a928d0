#ifndef ORVANE_PLATFORM_EVENT_H
#define ORVANE_PLATFORM_EVENT_H

#include <cstdint>
#include <functional>
#include <future>
#include <map>
#include <memory>
#include <string>

#include <utils/RefBase.h>
#include <utils/StrongPointer.h>

#include "platform/event_handler.h"

namespace android {
namespace Orvane {

// Categories of an event (its eventType), by which storage and log collection route it.
inline constexpr uint32_t kEventTypeControl = 1;
inline constexpr uint32_t kEventTypeFault = 2;
inline constexpr uint32_t kEventTypeRaw = 4;

// The ids of fault events: the ones that are stored, privacy-checked and may have logs collected.
inline constexpr bool IsFaultEventId(uint32_t id) {
    return (id >= 800000000 && id <= 888888888) || (id >= 900000000 && id <= 999999999);
}

// Value keys of an event that several components read or write.
inline constexpr char kKeyParamList[] = "param_list";
inline constexpr char kKeyRawEventDbId[] = "rawEventDbID";
inline constexpr char kKeyDropReason[] = "dropReason";
inline constexpr char kKeyNoCatchLog[] = "noCatchLog";
inline constexpr char kKeyZipLogName[] = "zipLogName";
inline constexpr char kKeySubscribe[] = "subscribe";
inline constexpr char kKeyExpire[] = "expire";
inline constexpr char kKeyVisible[] = "visible";
inline constexpr char kKeyServiceUploadRet[] = "EVENT_SERVICE_UPLOAD_RET";
inline constexpr char kKeyUeUpdate[] = "EVENT_UE_UPDATE";
// Values of kKeyNoCatchLog.
inline constexpr char kWaitLogCatch[] = "WAIT_LOG_CATCH";
inline constexpr char kNoLogConfig[] = "NO_LOG_CONFIG";

// The record that moves through the daemon. It takes no locks: as it passes a pipeline, one
// thread at a time (the loop of the plugin now handling it) owns it and may annotate it;
// listeners on other loops only read it.
class Event : public virtual RefBase {
public:
    explicit Event(const std::string& sender);
    ~Event() override {}

    // Stores `value` under `key` in `extraParams` when `extra`, else in `params`; an empty key
    // is ignored.
    void SetValue(const std::string& key, const std::string& value, bool extra = false);
    void SetValue(const std::string& key, int value, bool extra = false);
    // Empty when the key is absent.
    std::string GetValue(const std::string& key, bool extra = false) const;
    // -1 when the key is absent, else the text through StringUtil::ConvertInt.
    int GetIntValue(const std::string& key, bool extra = false) const;
    std::map<std::string, std::string> GetKeyValuePairs(bool extra = false) const;
    // Creation time again, now, in wall-clock microseconds.
    void ResetTimestamp();

    uint32_t eventType;
    // Set to 1; the unordered dispatcher matches it against its own type.
    uint32_t dispatchType;
    uint16_t reservedShort;
    uint32_t eventId;
    // As the source gives it; storage reads it as seconds since the epoch.
    uint64_t happenTime;
    uint64_t reservedLong;
    // Wall-clock microseconds.
    uint64_t timestamp;
    std::string sender;
    bool reservedFlag;
    std::map<std::string, std::string> params;
    std::map<std::string, std::string> extraParams;

private:
    std::map<std::string, std::string>& Params(bool extra) { return extra ? extraParams : params; }
    const std::map<std::string, std::string>& Params(bool extra) const { return extra ? extraParams : params; }
};

// The work of a synchronous loop entry and the result that its caller waits for. It runs at most
// once. One destroyed without having run (its loop stopped first) gives its caller -1 with one
// error line, so that no caller waits for good and no failure needs an exception.
class SyncTask {
public:
    SyncTask(std::string loopName, std::function<EVENT_RET()> work);
    ~SyncTask();
    SyncTask(const SyncTask&) = delete;
    SyncTask& operator=(const SyncTask&) = delete;

    // Runs the work on the calling thread and hands its result to the waiting caller.
    void operator()();
    // Called once, by the caller that is to wait.
    std::future<EVENT_RET> GetResult() { return result_.get_future(); }

private:
    const std::string loopName_;
    std::function<EVENT_RET()> work_;
    std::promise<EVENT_RET> result_;
    bool ran_ = false;
};

// One entry of an event loop's queue: an event for a handler, a task, or a synchronous task
// whose caller waits for its result. Times are nanoseconds of the monotonic clock since system
// start. Owned by the loop's queue; a copy shares event, handler and syncTask.
struct LoopEvent {
    bool isRepeat = false;
    // 0 asynchronous (event for a handler, or task), 1 synchronous (syncTask).
    int32_t taskType = 0;
    // The delay it was added with; the period of a repeating entry.
    uint64_t interval = 0;
    // When it was added; its identifier.
    uint64_t createTime = 0;
    uint64_t enqueueTime = 0;
    // enqueueTime + interval.
    uint64_t targetTime = 0;
    sp<Event> event;
    sp<EventHandler> handler;
    std::function<void()> task;
    std::shared_ptr<SyncTask> syncTask;

    // Later entries are "less", so a max-heap keeps the earliest due one on top. Equal due
    // times are not ordered further.
    bool operator<(const LoopEvent& other) const { return targetTime > other.targetTime; }
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLATFORM_EVENT_H
