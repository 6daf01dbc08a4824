#include "sabled/Lookup.h"

#include <fmt/core.h>

#include <any>
#include <cerrno>

#include "SableKit/SBLConstants.h"
#include "platform/FileManager.h"
#include "platform/Platform.h"
#include "platform/URL.h"
#include "platform/UserDefaults.h"
#include "sabled/Assembly.h"
#include "sabled/DownloadManager.h"
#include "sabled/SableLogging.h"
#include "sabled/SplitText.h"

namespace sable {
namespace {

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryLookUp);
}

template <class T>
std::optional<T> member(const platform::Notification& notification, const char* key) {
  const auto found = notification.userInfo.find(key);
  const T* value = found == notification.userInfo.end() ? nullptr : std::any_cast<T>(&found->second);
  return value == nullptr ? std::nullopt : std::optional(*value);
}

std::string identifierOf(platform::DataDetectorSource kind) {
  return std::string(kind == platform::DataDetectorSource::lookupHintsMonthly ? kSBLLookupHintsMonthly
                                                                              : kSBLLookupHintsWeekly);
}

/// "" where there is none.
std::string versionOf(const std::string& identifier, const std::map<std::string, std::string>& versions) {
  const auto found = versions.find(identifier);
  return found == versions.end() ? std::string() : found->second;
}

const char* shown(const std::string& text) {
  return text.empty() ? "(null)" : text.c_str();
}

}  // namespace

Lookup::Lookup(Assembly& assembly)
    : assembly_(assembly), queue_(assembly.runtime.serialQueue("com.kestrel.sable.Lookup")) {
  using platform::Notification;
  auto& center = assembly.notificationCenter;
  for (const auto name : {kSBLFileDownloadCompletedNotification, kSBLFileDeletedNotification}) {
    observations_.push_back(center.observe(
        std::string(name), [this](const Notification& notification) { _handleHintsFile(notification); }));
  }
  observations_.push_back(
      center.observe("SBLStartup", [this](const Notification&) { _reprocessHintsFiles(); }));
}

Lookup::~Lookup() = default;

bool Lookup::lookupEnabled() const {
  return !assembly_.userDefaults.sharedBoolean(platform::kLookupDomain, "LookupSuggestionsDisabled")
              .value_or(false);
}

std::string Lookup::signatureFromURL(std::string_view url) {
  const auto parsed = platform::URL::parse(url);
  const auto parts = split(parsed ? parsed->path() : std::string(), '/');
  if (parts.size() > 4) return fmt::format("{}-{}-{}", parts[3], parts[4], parts[2]);
  log().error("invalid lookup hints url when processing signature: {}", url);
  return {};
}

void Lookup::_drainQueue() {
  queue_->sync([] {});
}

void Lookup::_handleHintsFile(const platform::Notification& notification) {
  const auto identifier = member<std::string>(notification, "identifier");
  if (identifier != kSBLLookupHintsWeekly && identifier != kSBLLookupHintsMonthly) return;
  const auto kind =
      identifier == kSBLLookupHintsMonthly ? Source::lookupHintsMonthly : Source::lookupHintsWeekly;
  queue_->async([this, kind, url = member<std::filesystem::path>(notification, "url")] {
    _handleHintsFile(url, kind);
  });
}

void Lookup::_handleHintsFile(const std::optional<std::filesystem::path>& url, Source sourceKind) {
  queue_->assertIsCurrent();
  const std::string location = url ? url->native() : "(null)";
  log().standard("processing lookup hints for location: {} sourceKind: {}", location,
                 static_cast<int>(sourceKind));
  auto file =
      url ? assembly_.fileManager.openForReading(*url) : tl::unexpected(posixError(ENOENT, "no location"));
  if (!file) {
    log().error("error trying to open hints file: {} at location: {}", file.error().description(), location);
    return;
  }
  _pushDDSourceFile(**file, sourceKind, versionOf(identifierOf(sourceKind), resourceVersions()));
}

void Lookup::_pushDDSourceFile(platform::ReadableFile& file, Source sourceKind, const std::string& version) {
  queue_->assertIsCurrent();
  const auto pushed = assembly_.platform.dataDetectors().pushSourceFile(file, sourceKind, version);
  if (pushed) return;
  log().error("failed to push data to data detectors");
  log().info("data detectors: {}", pushed.error().description());
}

void Lookup::_reprocessHintsFiles() {
  log().standard("reprocessing lookup hints files");
  queue_->async([this] {
    const Versions versions = resourceVersions();
    for (const auto kind : {Source::lookupHintsWeekly, Source::lookupHintsMonthly})
      _reprocessHintsFile(kind, versions);
  });
}

Lookup::Versions Lookup::resourceVersions() const {
  return assembly_.downloadManager == nullptr ? Versions() : assembly_.downloadManager->resourceVersions();
}

void Lookup::_reprocessHintsFile(Source sourceKind, const Versions& versions) {
  queue_->assertIsCurrent();
  const std::string identifier = identifierOf(sourceKind);
  const std::string version = versionOf(identifier, versions);
  const std::string signature = assembly_.platform.dataDetectors().clientSignature(sourceKind).value_or("");
  if (signature == version || assembly_.downloadManager == nullptr) return;
  log().standard("signature ({}) does not match version ({}), DD for kind: {} requires reprocessing",
                 shown(signature), shown(version), static_cast<int>(sourceKind));
  platform::FileAttributes attributes;
  const auto file = assembly_.downloadManager->fileHandleForResource(identifier, attributes);
  if (!file) {
    log().error("reprocess file doesn't exist or there was an error. file: (null) error: {}",
                file.error().description());
    return;
  }
  _pushDDSourceFile(**file, sourceKind, version);
}

}  // namespace sable
