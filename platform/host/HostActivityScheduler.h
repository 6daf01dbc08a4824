#pragma once

#include <filesystem>
#include <string>

#include "platform/FileManager.h"
#include "platform/TimedActivityScheduler.h"
#include "platform/host/HostFacts.h"

namespace sable::platform::host {

/// The file of the scheduler's record: a JSON object of activities by identifier, each with
/// "last_run" and "next_run" in seconds since 1970 where there is one. Tools read it, too.
std::string encodeActivityRecord(const ActivityRecord& record);
/// Empty when the text is no such object; an activity that has no such form is left out.
ActivityRecord decodeActivityRecord(std::string_view text);

/// Longer files hold no record.
inline constexpr std::size_t kMaximumActivityRecordBytes = 64u << 10;

/// Activities over this machine's timers, with its battery as the facts, or else the kernel, know it,
/// and a record of runs in `file`. Without a file that can be written each process begins anew.
class HostActivityScheduler final : public ActivityScheduler {
 public:
  HostActivityScheduler(Runtime& runtime, NotificationCenter& center, const HostFacts& facts,
                        FileManager& fileManager, std::filesystem::path file);

  void registerActivity(std::string identifier, const ActivityCriteria& criteria, Handler handler) override;
  void unregister(std::string_view identifier) override;

 private:
  class Host final : public ActivityHost {
   public:
    Host(const HostFacts& facts, FileManager& fileManager, std::filesystem::path file);
    bool onBattery() override;
    ActivityRecord load() override;
    void save(const ActivityRecord& record) override;

   private:
    Expected<void> write(const ActivityRecord& record);

    const HostFacts& facts_;
    FileManager& fileManager_;
    const std::filesystem::path file_;
    bool failureLogged_ = false;
  };

  Host host_;
  TimedActivityScheduler scheduler_;
};

}  // namespace sable::platform::host
