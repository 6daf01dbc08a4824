#include <fmt/format.h>
#include <gtest/gtest.h>

#include "sabled/Assembly.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "tests/support/VirtualDevice.h"

// The requests that no client can cause, item by item and header by header.
namespace sable::test {
namespace {

using platform::HTTPCachePolicy;
using platform::HTTPRequest;

/// Everything that distinguishes a request, a line each.
std::string wire(const HTTPRequest& request) {
  std::string lines =
      fmt::format("{} {}\n{} s{}{}\n", request.method, request.url, request.timeout,
                  request.cachePolicy == HTTPCachePolicy::ignoreLocal ? ", past the cache" : "",
                  request.proxied ? ", proxied" : "");
  for (const auto& [name, value] : request.headers.fields()) lines += fmt::format("{}: {}\n", name, value);
  return lines;
}

constexpr const char* kWarmURL = "https://service.test/warm?b=2&a=1";
constexpr const char* kFileURL = "https://files.test/hints";
constexpr const char* kUploadURL = "https://service.test/feedback";

struct Device {
  bool isKnown = true;  ///< where it is and what its user allows
  std::string debugParameters = {};
  bool hasProxy = false;
};

class RequestFactory : public testing::Test {
 protected:
  SBLNetworkRequestFactory& factoryOn(const Device& is) {
    device_.emplace();
    device_->platform.countryConfiguration().change(is.isKnown ? "US" : "");
    device_->platform.managedConfiguration().values.diagnosticsAllowed = is.isKnown;
    device_->platform.userDefaults().setByUser("SBLDebugParameters", is.debugParameters);
    device_->platform.userDefaults().setByUser("SBLUseBramble", is.hasProxy);
    if (is.hasProxy) device_->bag["bramble"] = {{"proxy", "http://proxy.test:8080"}, {"enabled", true}};
    device_->start();
    if (is.hasProxy) device_->client();  // without a client there is no bag, and no proxy in it
    return *device_->assembly().requestFactory;
  }

 private:
  std::optional<VirtualDevice> device_;
};

TEST_F(RequestFactory, WhatNoClientCausesHasExactlyItsItemsAndHeaders) {
  using Factory = SBLNetworkRequestFactory;
  const struct {
    const char* name;
    Device device;
    HTTPRequest (*make)(Factory&);
    const char* wire;
  } rows[] = {
      {"warm",
       {},
       [](Factory& factory) { return factory.warmRequest(kWarmURL); },
       "GET https://service.test/warm?a=1&b=2\n"
       "60 s, past the cache\n"},
      {"warm, with debug parameters, which it has no use for",
       {.debugParameters = "key=abc"},
       [](Factory& factory) { return factory.warmRequest(kWarmURL); },
       "GET https://service.test/warm?a=1&b=2\n"
       "60 s, past the cache\n"},
      {"warm, through the proxy",
       {.hasProxy = true},
       [](Factory& factory) { return factory.warmRequest(kWarmURL); },
       "GET https://service.test/warm?a=1&b=2\n"
       "60 s, past the cache, proxied\n"},
      {"download",
       {},
       [](Factory& factory) { return factory.fileDownloadRequest(kFileURL, "", false); },
       "GET https://files.test/hints?key=tandem4371\n"
       "60 s\n"
       "User-Agent: Sabled/1.0 (SableBook1,1; Sable OS 1A1) Beacon/1\n"},
      {"download of a newer version, its location not known",
       {},
       [](Factory& factory) { return factory.fileDownloadRequest(kFileURL, "\"v7\"", true); },
       "GET https://files.test/hints?key=tandem4371\n"
       "60 s\n"
       "User-Agent: Sabled/1.0 (SableBook1,1; Sable OS 1A1) Beacon/1\n"
       "If-None-Match: \"v7\"\n"},
      {"download, with debug parameters and a proxy, which it has no use for",
       {.debugParameters = "key=abc", .hasProxy = true},
       [](Factory& factory) { return factory.fileDownloadRequest(kFileURL, "", false); },
       "GET https://files.test/hints?key=tandem4371\n"
       "60 s\n"
       "User-Agent: Sabled/1.0 (SableBook1,1; Sable OS 1A1) Beacon/1\n"},
      {"download from a URL with a key of its own",
       {},
       [](Factory& factory) {
         return factory.fileDownloadRequest("https://files.test/?key=own&z", "", false);
       },
       "GET https://files.test/?key=own&z\n"
       "60 s\n"
       "User-Agent: Sabled/1.0 (SableBook1,1; Sable OS 1A1) Beacon/1\n"},
      {"upload",
       {},
       [](Factory& factory) { return factory.flusherUploadRequest(kUploadURL, 12.5, "d1gest"); },
       "POST https://service.test/feedback?cc=US&du_enabled=1&key=tandem4371&locale=en_US\n"
       "12.5 s, past the cache\n"
       "X-Kestrel-Languages: [\"en-US\"]\n"
       "User-Agent: Sabled/1.0 (SableBook1,1; Sable OS 1A1) Sabled/1.0\n"
       "X-Kestrel-Digest: d1gest\n"
       "Content-Encoding: deflate\n"},
      {"upload from a device that says little",
       {.isKnown = false},
       [](Factory& factory) { return factory.flusherUploadRequest(kUploadURL, 60, ""); },
       "POST https://service.test/feedback?key=tandem4371&locale=en_US\n"
       "60 s, past the cache\n"
       "X-Kestrel-Languages: [\"en-US\"]\n"
       "User-Agent: Sabled/1.0 (SableBook1,1; Sable OS 1A1) Sabled/1.0\n"
       "X-Kestrel-Digest: \n"
       "Content-Encoding: deflate\n"},
      {"upload: debug parameters win over everything, the URL's own items over the rest; never proxied",
       {.debugParameters = "key=abc&locale=xx&no&d=1=2&extra=1", .hasProxy = true},
       [](Factory& factory) {
         return factory.flusherUploadRequest("https://service.test/feedback?cc=NZ&locale=fr&a=;", 60, "d");
       },
       "POST https://service.test/feedback?a=%3B&cc=NZ&du_enabled=1&extra=1&key=abc&locale=xx\n"
       "60 s, past the cache\n"
       "X-Kestrel-Languages: [\"en-US\"]\n"
       "User-Agent: Sabled/1.0 (SableBook1,1; Sable OS 1A1) Sabled/1.0\n"
       "X-Kestrel-Digest: d\n"
       "Content-Encoding: deflate\n"},
  };
  for (const auto& row : rows) EXPECT_EQ(wire(row.make(factoryOn(row.device))), row.wire) << row.name;
}

}  // namespace
}  // namespace sable::test
