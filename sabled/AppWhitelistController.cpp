#include "sabled/AppWhitelistController.h"

#include <any>
#include <cerrno>
#include <nlohmann/json.hpp>

#include "SableKit/SBLConstants.h"
#include "platform/ApplicationRegistry.h"
#include "platform/Transaction.h"
#include "platform/UserDefaults.h"
#include "sabled/AppWhitelist.h"
#include "sabled/Assembly.h"
#include "sabled/DownloadManager.h"
#include "sabled/SableLogging.h"

namespace sable {
namespace {

constexpr std::string_view kSignatureKey = "SBLAppWhitelistSignature";
constexpr std::string_view kApplicationsKey = "SBLAppWhitelistApplications";
/// Applications come and go in bursts: only the last change of one counts.
constexpr platform::Duration kDelayAfterChange = std::chrono::seconds(60);

constexpr const char* kUnreadable = "error reading app whitelist {}";

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategorySable);
}

std::optional<AppWhitelistSignature> savedSignature(const platform::UserDefaults& defaults) {
  auto text = defaults.string(kSignatureKey);
  if (!text) return std::nullopt;
  AppWhitelistSignature signature{std::move(*text), {}};
  for (const Dictionary& application : defaults.array(kApplicationsKey).value_or(Dictionary::array())) {
    if (application.is_string()) signature.applications.push_back(application.get<std::string>());
  }
  return signature;
}

}  // namespace

AppWhitelistController::AppWhitelistController(Assembly& assembly)
    : assembly_(assembly),
      backgroundQueue_(assembly.runtime.serialQueue("com.kestrel.sabled.appWhitelist",
                                                    platform::QualityOfService::background)),
      signatureQueue_(assembly.runtime.concurrentQueue("com.kestrel.sabled.appWhitelistSignature")),
      whitelistSignature_(savedSignature(assembly.userDefaults)) {
  registerToken_ = assembly_.notificationCenter.observe(
      std::string(platform::kApplicationsDidChangeNotification),
      [this](const platform::Notification&) { backgroundQueue_->async([this] { armTimer(); }); });
  backgroundQueue_->async([this, isKnown = whitelistSignature_.has_value()] {
    assembly_.platform.applicationRegistry();  // from now on it tells of changes
    if (!isKnown) _generateWhitelistSignature();
  });
  newFileToken_ = assembly_.notificationCenter.observe(
      std::string(kSBLFileDownloadCompletedNotification),
      [this](const platform::Notification& notification) { _handleNewWhitelistFile(notification); });
}

AppWhitelistController::~AppWhitelistController() = default;

std::optional<std::string> AppWhitelistController::whitelistSignature() const {
  return signatureQueue_->sync([this]() -> std::optional<std::string> {
    if (!whitelistSignature_) return std::nullopt;
    return whitelistSignature_->text;
  });
}

std::vector<std::string> AppWhitelistController::signedApplications() const {
  return signatureQueue_->sync([this] {
    return whitelistSignature_ ? whitelistSignature_->applications : std::vector<std::string>();
  });
}

void AppWhitelistController::armTimer() {
  backgroundQueue_->assertIsCurrent();
  timer_ = backgroundQueue_->after(kDelayAfterChange, [this] { _generateWhitelistSignature(); });
}

void AppWhitelistController::_handleNewWhitelistFile(const platform::Notification& notification) {
  const auto found = notification.userInfo.find("identifier");
  const auto* identifier =
      found == notification.userInfo.end() ? nullptr : std::any_cast<std::string>(&found->second);
  if (identifier == nullptr || *identifier != kSBLInstalledAppWhitelist) return;
  backgroundQueue_->async([this] { _generateWhitelistSignature(); });
}

void AppWhitelistController::_generateWhitelistSignature() {
  backgroundQueue_->assertIsCurrent();
  if (generating_.exchange(true)) return;
  const auto transaction = assembly_.platform.transactions().open("appWhitelist");
  auto signature = _generate();
  assembly_.userDefaults.set(kSignatureKey, signature ? Dictionary(signature->text) : Dictionary());
  assembly_.userDefaults.set(kApplicationsKey,
                             signature ? Dictionary(signature->applications) : Dictionary());
  signatureQueue_->barrierSync([&] { whitelistSignature_ = std::move(signature); });
  generating_ = false;
}

std::optional<AppWhitelistSignature> AppWhitelistController::_generate() {
  log().standard("generating app whitelist");
  if (assembly_.downloadManager == nullptr) return std::nullopt;
  platform::FileAttributes attributes;
  const auto file =
      assembly_.downloadManager->fileHandleForResource(std::string(kSBLInstalledAppWhitelist), attributes);
  if (!file) {
    // That there is none yet is no fault.
    const bool isFault = file.error().domain != kPOSIXErrorDomain || file.error().code != ENOENT;
    if (isFault) log().error(kUnreadable, file.error().description());
    if (!isFault) log().info(kUnreadable, file.error().description());
    return std::nullopt;
  }
  const auto bytes = (*file)->map(kMaximumWhitelistBytes);
  if (!bytes) {
    log().error("mmap failed {}", bytes.error().description());
    return std::nullopt;
  }
  auto signature = processWhitelist(*bytes, assembly_.platform.applicationRegistry());
  log().standard("installed app signature: {}", signature ? signature->text : "(null)");
  return signature;
}

}  // namespace sable
