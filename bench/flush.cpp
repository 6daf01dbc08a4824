// Packing 100 MB of sessions for their upload, from their files to compressed JSON and its digest. The
// floor compresses the same JSON at the same level in one go and takes the same digest; what it does
// not do is read files, translate records and write the result.
#include <fmt/core.h>
#include <malloc.h>
#include <openssl/evp.h>
#include <stdlib.h>
#include <zlib.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <nlohmann/json.hpp>
#include <random>
#include <string>
#include <vector>

#include "bench/support/Bench.h"
#include "platform/Log.h"
#include "platform/UserDefaults.h"
#include "platform/host/HostPlatform.h"
#include "sabled/Assembly.h"
#include "sabled/ClientSession.h"
#include "sabled/DaemonFeedback.h"
#include "sabled/FileContainer.h"
#include "sabled/SableFeedback.h"
#include "sabled/SableFeedbackFlusher.h"
#include "sabled/SablePersistentStorage.h"

namespace {

using namespace sable::bench;

constexpr int kFeedbacks = 1;
constexpr std::size_t kWholeBytes = 100'000'000;

/// What a user does in a session, again and again, as far as the daemon itself records it.
std::shared_ptr<sable::SableFeedback> feedback(sable::Assembly& assembly, std::mt19937& random) {
  constexpr const char* kWords[] = {"weather", "pizza near me", "how tall is", "train to", "news", "cinema"};
  std::string uuid = sable::UUID{}.string();
  for (char& c : uuid) {
    if (c == '0') c = "0123456789ABCDEF"[random() % 16];
  }
  const std::string input = std::string(kWords[random() % 6]) + ' ' + std::to_string(random() % 1000);
  sable::platform::HTTPRequest request;
  request.url = "https://search.example/search?q=" + input + "&locale=en_GB&cc=GB&qid=" + uuid;
  request.headers.set("X-Kestrel-UI-Scale", "2.0");
  request.headers.set("User-Agent", "Sabled/1.0 (SableBook1,1; Debian GNU/Linux 12.5) Beacon/1");
  auto message = random() % 2 == 0 ? sable::feedback::startNetworkSearch(
                                         assembly.runtime.ticks(),
                                         {1, sable::feedback::Endpoint::sableSearch, input, request, uuid})
                                   : sable::feedback::cacheHit(assembly.runtime.ticks(), input, uuid);
  return std::make_shared<sable::SableFeedback>(std::move(message), static_cast<std::int64_t>(random() % 100),
                                                std::nullopt, "Beacon/1");
}

/// Complete sessions that fill their files.
void makeSessions(sable::Assembly& assembly, std::size_t bytesEach, std::size_t count) {
  std::mt19937 random(1);
  for (; count > 0; --count) {
    sable::ClientSession session(assembly, feedback(assembly, random));
    for (std::size_t bytes = 0; bytes < bytesEach - 4096;) {
      const auto record = feedback(assembly, random);
      bytes += record->data().size() + 8;
      session.addFeedback(record);
    }
    session.sessionComplete();
  }
}

/// Packs one session, while the storage reads the next. No bag names a place to upload it to, so that is
/// all: its file is deleted.
void pack(sable::SableFeedbackFlusher& flusher, sable::FileContainer& container, sable::FileContainer* next) {
  auto session = container.read();
  if (!session) fail("a session cannot be read");
  if (next != nullptr) next->readAhead();
  flusher.flushSyncFromArray({std::move(session)});
  flusher.flushToWireSync(false);
}

std::string jsonOf(sable::FileContainer& container) {
  std::string text;
  container.read()->writeFeedbacksToSend([&](std::string_view json) { text += json; });
  return text;
}

void floorOf(const std::string& json, std::string& compressed) {
  z_stream stream{};
  deflateInit2(&stream, Z_DEFAULT_COMPRESSION, Z_DEFLATED, -MAX_WBITS, MAX_MEM_LEVEL - 1, Z_DEFAULT_STRATEGY);
  compressed.resize(deflateBound(&stream, json.size()));
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(json.data()));
  stream.avail_in = static_cast<uInt>(json.size());
  stream.next_out = reinterpret_cast<Bytef*>(compressed.data());
  stream.avail_out = static_cast<uInt>(compressed.size());
  if (deflate(&stream, Z_FINISH) != Z_STREAM_END) fail("deflate");
  deflateEnd(&stream);
  unsigned char digest[EVP_MAX_MD_SIZE];
  EVP_Digest(json.data(), json.size(), digest, nullptr, EVP_sha512(), nullptr);
}

double sum(const Microseconds& times) {
  double all = 0;
  for (const double time : times) all += time;
  return all;
}

/// Megabytes of JSON a second, both sides session by session in turns.
void measureSpeed(sable::Assembly& assembly, sable::SableFeedbackFlusher& flusher, int argc, char** argv) {
  const auto containers = assembly.persistentStorage->getAvailableSessionHandles();
  std::vector<std::string> texts;
  for (const auto& container : containers) texts.push_back(jsonOf(*container));
  Microseconds times, floors;
  std::size_t bytes = 0;
  std::string compressed;
  for (std::size_t i = 0; i < containers.size(); ++i) {
    measure(1, floors, [&] { floorOf(texts[i], compressed); });
    auto* const next = i + 1 < containers.size() ? containers[i + 1].get() : nullptr;
    measure(1, times, [&] { pack(flusher, *containers[i], next); });
    bytes += texts[i].size();
  }
  report({"flush", "MB/s", static_cast<double>(bytes) / sum(times), static_cast<double>(bytes) / sum(floors),
          0.85, true},
         argc, argv);
}

/// What VmHWM grows by while a session of `bytes` is packed.
double peakMiB() {
  std::ifstream status("/proc/self/status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with("VmHWM:")) return std::stod(line.substr(6)) / 1024;
  }
  fail("no VmHWM");
}

void measureMemory(sable::Assembly& assembly, sable::SableFeedbackFlusher& flusher, std::size_t mebibytes,
                   int argc, char** argv) {
  makeSessions(assembly, mebibytes << 20, 1);
  const auto container = assembly.persistentStorage->getAvailableSessionHandles().back();
  ::malloc_trim(0);
  std::ofstream("/proc/self/clear_refs") << "5";  // VmHWM begins anew
  const double before = peakMiB();
  pack(flusher, *container, nullptr);
  report(
      {fmt::format("flush_memory_{}_mib", mebibytes), "MiB", peakMiB() - before, std::nullopt, std::nullopt},
      argc, argv);
}

}  // namespace

int main(int argc, char** argv) {
  char folder[] = "/tmp/sabled-bench-XXXXXX";
  if (::mkdtemp(folder) == nullptr) fail("mkdtemp");
  const std::filesystem::path root = folder;
  for (const char* name :
       {"SABLED_RUNTIME_DIR", "SABLED_CACHES_DIR", "SABLED_STATE_DIR", "SABLED_CONFIG_DIR", "SABLED_PROFILE"})
    ::setenv(name, (root / name).c_str(), 1);
  {
    sable::platform::host::HostPlatform device;
    device.userDefaults().set("SBLSessionSizeLimit", std::int64_t{64} << 20);
    sable::Assembly assembly(device);
    assembly.persistentStorage = std::make_unique<sable::SablePersistentStorage>(assembly);
    sable::SableFeedbackFlusher flusher(assembly, kFeedbacks);
    for (const std::size_t mebibytes : {2, 16}) measureMemory(assembly, flusher, mebibytes, argc, argv);
    makeSessions(assembly, 2u << 20, kWholeBytes / (2u << 20));
    measureSpeed(assembly, flusher, argc, argv);
  }
  std::error_code ignored;
  std::filesystem::remove_all(root, ignored);
}
