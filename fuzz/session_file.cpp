#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <nlohmann/json.hpp>

#include "platform/simulated/SimulatedPlatform.h"
#include "sabled/ArchivedDataIterator.h"
#include "sabled/Assembly.h"
#include "sabled/ClientSession.h"
#include "sabled/FileContainer.h"

namespace {

using namespace sable;

/// Records lie behind each other within the bytes.
void walk(std::string_view bytes) {
  ArchivedDataIterator records(bytes);
  while (records.hasMore()) {
    const auto record = records.readNextObject();
    if (!record) return;
    if (record->empty() || record->data() + record->size() != bytes.data() + records.position()) std::abort();
  }
}

}  // namespace

// A session file is read without harm whatever is in it: the bytes are tried as a whole file, and as
// what follows the version.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static platform::simulated::SimulatedPlatform device;
  static Assembly assembly(device);
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  walk(bytes);

  const std::string version(1, 'v');
  const auto path = *device.fileManager().cachesDirectory() / "session.0";
  for (const std::string& file : {std::string(bytes), std::string("\1\0\0\0\0\0\0\0v", 9).append(bytes)}) {
    if (!device.fileManager().writeAtomically(path, file)) std::abort();
    const auto container = std::make_shared<FileContainer>(assembly, path, version,
                                                           device.runtime().serialQueue("fuzz"), 1u << 20);
    const auto session = container->read();
    if (session && compactJSON(session->getFeedbacksToSend()).empty()) std::abort();
  }
  return 0;
}
