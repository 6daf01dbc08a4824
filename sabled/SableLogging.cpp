#include "sabled/SableLogging.h"

#include <cstdio>
#include <cstdlib>

#include "SableKit/SBLConstants.h"

namespace sable {
namespace {

using platform::LogHandle;

constexpr LogHandle kHandles[] = {
    {kSBLSubsystem, "Sable"},
    {kSBLSubsystem, "Sable_Feedback"},
    {kSBLSubsystem, "Sable_Session"},
    {kSBLSubsystem, "Sable_Request"},
    {kSBLSubsystem, "Sable_Flusher"},
    {kSBLSubsystem, "Sable_Search"},
    {kSBLSubsystem, "Sable_ZeroKeyword"},
    {kSBLSubsystem, "Sable_MoreResults"},
    {kSBLSubsystem, "Sable_Card"},
    {kSBLSubsystem, "Sable_LookUp"},
    {kSBLSubsystem, "Sable_Flight"},
    {kSBLSubsystem, "Sable_Images"},
    {kSBLSubsystem, "Sable_Connection"},
    {kSBLSubsystem, "Sable_DownloadManager"},
    {kSBLSubsystem, "Sable_Bag"},
    {kSBLSubsystem, "Sable_Subscription"},
    {kSBLSubsystem, "Sable_Caching"},
    {kSBLSubsystem, "Sable_Feedback_Errors"},
    {kSBLSubsystem, "Sable_Feedback_Storage"},
};
static_assert(std::size(kHandles) == SableLoggingCategoryCount);

constexpr LogHandle kDefaultHandle{kSBLSubsystem, ""};

}  // namespace

const LogHandle& SableLogForCategory(unsigned category) {
  if (category >= SableLoggingCategoryCount) {
    std::fprintf(stderr, "%s: assertion failed: category < SableLoggingCategoryCount\n", __func__);
    std::abort();
  }
  return kHandles[category];
}

const LogHandle& SableDefaultLog() {
  return kDefaultHandle;
}

}  // namespace sable
