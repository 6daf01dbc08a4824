#include "SableKit/messages/MessageJSON.h"

#include <google/protobuf/descriptor.h>
#include <google/protobuf/descriptor.pb.h>
#include <google/protobuf/dynamic_message.h>
#include <google/protobuf/stubs/logging.h>
#include <google/protobuf/util/json_util.h>

#include <nlohmann/json.hpp>
#include <utility>

namespace sable {

namespace {

namespace protobuf = google::protobuf;

constexpr std::string_view kPackage = "sable.messages.";
constexpr unsigned char kDescriptors[] = {
#include "SableKit/messages/Descriptors.inc"
};

/// The definitions, read once from what the compiler of the messages has left in the program.
class Definitions {
 public:
  static Definitions& shared() {
    static Definitions definitions;
    return definitions;
  }

  const protobuf::FileDescriptorSet& files() const { return files_; }

  std::unique_ptr<protobuf::Message> make(std::string_view className) {
    const auto* type = pool_.FindMessageTypeByName(std::string(kPackage) + std::string(className));
    return std::unique_ptr<protobuf::Message>(type == nullptr ? nullptr : factory_.GetPrototype(type)->New());
  }

 private:
  Definitions() {
    files_.ParseFromArray(kDescriptors, sizeof kDescriptors);
    for (const auto& file : files_.file()) pool_.BuildFile(file);
  }

  protobuf::FileDescriptorSet files_;
  protobuf::DescriptorPool pool_;
  protobuf::DynamicMessageFactory factory_;
};

tl::unexpected<Error> failure(MessageErrorCode code, std::string reason) {
  return tl::unexpected(
      Error{std::string(kMessageErrorDomain), static_cast<std::int64_t>(code), std::move(reason)});
}

tl::unexpected<Error> unknownClass(std::string_view className) {
  return failure(MessageErrorCode::unknownClass, "no message class " + std::string(className));
}

const protobuf::FieldDescriptor* field(const protobuf::Message& message, const char* name) {
  return message.GetDescriptor()->FindFieldByName(name);
}

/// The library's own line on standard error is held back.
bool parse(protobuf::Message& message, std::string_view bytes) {
  const protobuf::LogSilencer silence;
  return std::in_range<int>(bytes.size()) &&
         message.ParseFromArray(bytes.data(), static_cast<int>(bytes.size()));
}

}  // namespace

Expected<std::string> messageFromJSON(std::string_view className, std::string_view json) {
  const auto message = Definitions::shared().make(className);
  if (message == nullptr) return unknownClass(className);
  const auto status =
      protobuf::util::JsonStringToMessage(protobuf::StringPiece(json.data(), json.size()), message.get());
  if (!status.ok()) return failure(MessageErrorCode::malformed, status.message().ToString());
  return message->SerializeAsString();
}

Expected<std::string> messageToJSON(std::string_view className, std::string_view bytes) {
  const auto message = Definitions::shared().make(className);
  if (message == nullptr) return unknownClass(className);
  if (!parse(*message, bytes)) {
    return failure(MessageErrorCode::malformed, "the bytes are no " + std::string(className));
  }
  std::string json;
  const auto status = protobuf::util::MessageToJsonString(*message, &json);
  if (!status.ok()) return failure(MessageErrorCode::malformed, status.message().ToString());
  return json;
}

Expected<Dictionary> feedbackRecordDocument(std::string_view bytes) {
  const auto record = Definitions::shared().make("_SKSableFeedback");
  if (!parse(*record, bytes))
    return failure(MessageErrorCode::malformed, "the bytes are no _SKSableFeedback");
  const auto& payload = record->GetReflection()->GetMessage(*record, field(*record, "payload"));
  const auto className = payload.GetReflection()->GetString(payload, field(payload, "class_name"));
  const auto message =
      messageToJSON(className, payload.GetReflection()->GetString(payload, field(payload, "feedback")));
  if (!message) return tl::unexpected(message.error());
  return Dictionary{
      {"class", className},
      {"query_id", record->GetReflection()->GetInt64(*record, field(*record, "query_id"))},
      {"client_query_id", record->GetReflection()->GetUInt64(*record, field(*record, "client_query_id"))},
      {"message", parseJSON(*message, message->size()).value_or(Dictionary())}};
}

std::vector<std::string> messageClassNames() {
  std::vector<std::string> names;
  for (const auto& file : Definitions::shared().files().file()) {
    for (const auto& message : file.message_type()) names.push_back(message.name());
  }
  return names;
}

}  // namespace sable
