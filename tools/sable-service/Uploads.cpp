#include "Uploads.h"

#include <fmt/format.h>
#include <openssl/evp.h>
#include <zlib.h>

#include <array>

namespace service {

namespace {

constexpr size_t kInflatedLimit = 64U << 20U;

struct Inflated {
  std::string bytes;
  std::string reason;
};

Inflated inflateRaw(const std::string& body) {
  z_stream stream{};
  // Negative window bits: no header or checksum around the deflate stream.
  if (inflateInit2(&stream, -MAX_WBITS) != Z_OK) return {"", "inflate cannot start"};
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(body.data()));
  stream.avail_in = static_cast<uInt>(body.size());
  Inflated result;
  std::array<char, 65536> buffer{};
  int status = Z_OK;
  while (status == Z_OK && result.bytes.size() <= kInflatedLimit) {
    stream.next_out = reinterpret_cast<Bytef*>(buffer.data());
    stream.avail_out = buffer.size();
    status = inflate(&stream, Z_NO_FLUSH);
    result.bytes.append(buffer.data(), buffer.size() - stream.avail_out);
  }
  if (result.bytes.size() > kInflatedLimit)
    result.reason = "the body inflates to more than 64 MiB";
  else if (status == Z_BUF_ERROR)
    result.reason = "the deflate stream is cut short";
  else if (status != Z_STREAM_END)
    result.reason = "the body is no raw deflate stream";
  else if (stream.avail_in > 0)
    result.reason = "bytes follow the deflate stream";
  inflateEnd(&stream);
  return result;
}

std::string sha512(const std::string& bytes) {
  std::string digest(EVP_MAX_MD_SIZE, '\0');
  unsigned length = 0;
  EVP_Digest(bytes.data(), bytes.size(), reinterpret_cast<unsigned char*>(digest.data()), &length,
             EVP_sha512(), nullptr);
  digest.resize(length);
  return digest;
}

std::string hex(const std::string& bytes) {
  std::string text;
  for (const char c : bytes) text += fmt::format("{:02x}", static_cast<unsigned char>(c));
  return text;
}

std::string base64(const std::string& bytes) {
  std::string text((bytes.size() + 2) / 3 * 4 + 1, '\0');
  const int length =
      EVP_EncodeBlock(reinterpret_cast<unsigned char*>(text.data()),
                      reinterpret_cast<const unsigned char*>(bytes.data()), static_cast<int>(bytes.size()));
  text.resize(static_cast<size_t>(length));
  return text;
}

/// Discarded when it is no JSON or nested so deep that writing it down could exhaust the stack.
Json parse(const std::string& text) {
  constexpr int kDepthLimit = 512;
  bool tooDeep = false;
  Json document = Json::parse(
      text,
      [&](int depth, Json::parse_event_t, const Json&) {
        tooDeep = tooDeep || depth > kDepthLimit;
        return !tooDeep;
      },
      false);
  return tooDeep ? Json(Json::value_t::discarded) : document;
}

Answer refuse(Answer answer, int status, const std::string& reason) {
  Json record = std::move(answer.record);
  answer = Answer::error(status, reason);
  answer.record = std::move(record);
  answer.record["reason"] = reason;
  return answer;
}

}  // namespace

Answer Uploads::receive(const Request& request, bool accepted) {
  Answer answer = Answer::json(Json::object());
  answer.record = {{"digest_ok", false}, {"repeated", false}};
  const auto coding = request.header("Content-Encoding");
  if (!coding || !equalsIgnoringCase(*coding, "deflate")) {
    return refuse(std::move(answer), 415, "Content-Encoding is not deflate");
  }
  const Inflated inflated = inflateRaw(request.body);
  if (!inflated.reason.empty()) return refuse(std::move(answer), 400, inflated.reason);

  const std::string digest = sha512(inflated.bytes);
  answer.record["digest"] = hex(digest);
  const auto claimed = request.header("X-Kestrel-Digest");
  const bool matches = claimed && (equalsIgnoringCase(*claimed, hex(digest)) || *claimed == base64(digest));
  answer.record["digest_ok"] = matches;
  Json document = parse(inflated.bytes);
  const bool isJson = !document.is_discarded();
  if (isJson) answer.record["json"] = std::move(document);
  if (!claimed) return refuse(std::move(answer), 400, "X-Kestrel-Digest is missing");
  if (!matches)
    return refuse(std::move(answer), 400, "X-Kestrel-Digest is not the SHA-512 of the inflated body");
  if (!isJson)
    return refuse(std::move(answer), 400, "the inflated body is no JSON document of at most 512 levels");

  const std::lock_guard lock(mutex_);
  const std::pair key(request.path, digest);
  answer.record["repeated"] = seen_.contains(key);
  if (accepted) seen_.insert(key);
  return answer;
}

}  // namespace service
