#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <functional>
#include <memory>
#include <random>
#include <vector>

#include "sabled/CompressedOutputStream.h"
#include "sabled/NullStream.h"
#include "tests/support/Deflate.h"

// The stream that uploads go through, held against zlib's inflate and OpenSSL's digest.
namespace sable::test {
namespace {

/// Remembers how much it was given at a time; fails when `room` bytes are used up.
class Recording final : public OutputStream {
 public:
  explicit Recording(std::size_t room = SIZE_MAX) : room_(room) {}
  void open() override { ++opened; }
  std::ptrdiff_t write(std::string_view bytes) override {
    if (bytes.size() > room_) return failed_ = true, -1;
    room_ -= bytes.size();
    writes.push_back(bytes.size());
    return static_cast<std::ptrdiff_t>(bytes.size());
  }
  void close() override { ++closed; }
  StreamStatus streamStatus() const override { return failed_ ? StreamStatus::error : StreamStatus::open; }
  std::optional<Error> streamError() const override {
    if (failed_) return posixError(ENOSPC, "disk");
    return std::nullopt;
  }

  std::vector<std::size_t> writes;
  int opened = 0, closed = 0;

 private:
  std::size_t room_;
  bool failed_ = false;
};

/// Texts that compress well, hardly, and not at all, and mixtures of them.
std::string text(std::mt19937& random, std::size_t size) {
  constexpr std::string_view kBase64 = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string bytes;
  while (bytes.size() < size) {
    const std::size_t stretch = 1 + random() % 100'000;
    switch (random() % 4) {
      case 0:
        bytes.append(stretch, 'a');
        break;
      case 1:
        for (std::size_t i = 0; i < stretch; ++i) bytes += kBase64[random() % 64];
        break;
      case 2:
        for (std::size_t i = 0; i < stretch; ++i) bytes += static_cast<char>(random());
        break;
      default:
        for (std::size_t i = 0; i < stretch; i += 40)
          bytes += R"({"query_id":)" + std::to_string(random() % 1000) + R"(,"type":"search_start"},)";
    }
  }
  bytes.resize(size);
  return bytes;
}

TEST(CompressedOutputStream, TheDigestOfWhatIsWrittenOnceIsThatOfTheText) {
  std::mt19937 random(7);
  const auto check = [&](const std::string& bytes, const std::function<std::size_t()>& pieceSize) {
    CompressedOutputStream stream;
    for (std::size_t at = 0; at < bytes.size();) {
      const std::string_view piece = std::string_view(bytes).substr(at, pieceSize());
      ASSERT_TRUE(stream.writeOnce(piece));
      at += piece.size();
    }
    stream.close();
    EXPECT_EQ(stream.bytesRead(), bytes.size());
    ASSERT_EQ(stream.dataDigestForStream(), sha512(bytes));
    ASSERT_EQ(inflated(dynamic_cast<MemoryOutputStream&>(stream.outputStream()).bytes(), bytes.size()),
              bytes);
  };
  for (int round = 0; round < 12; ++round) {
    const std::string bytes = text(random, round == 0 ? 2u << 20 : random() % (1u << 20));
    check(bytes, [] { return std::string::npos; });
    check(bytes, [&] { return 1 + random() % 70'000; });
    check(bytes, [&] { return 1 + random() % 500; });
  }
  check(text(random, 70'000), [] { return 1; });
  check("", [] { return 1; });
}

TEST(CompressedOutputStream, AWriteEntersTheDigestOnceWithEachStep) {
  std::mt19937 random(7);
  std::string bytes;
  for (int i = 0; i < 300'000; ++i) bytes += static_cast<char>(random());
  const auto recording = new Recording;
  CompressedOutputStream stream{std::unique_ptr<OutputStream>(recording)};
  stream.open();
  EXPECT_EQ(stream.write(bytes), 300'000);
  const std::size_t steps = recording->writes.size();
  EXPECT_GT(steps, 50u);
  EXPECT_EQ(*std::ranges::max_element(recording->writes), 4096u);
  EXPECT_EQ(recording->writes.front(), 4096u) << "a step ends when its buffer is full";
  stream.close();
  EXPECT_EQ(recording->opened, 1);
  EXPECT_EQ(recording->closed, 1);
  // The last step may have had nothing to say.
  const auto digest = stream.dataDigestForStream();
  EXPECT_TRUE(digest == sha512(bytes, steps) || digest == sha512(bytes, steps + 1));

  CompressedOutputStream small;
  EXPECT_EQ(small.write("small"), 5);
  small.close();
  EXPECT_EQ(small.dataDigestForStream(), sha512("small")) << "one step";
}

TEST(CompressedOutputStream, TellsItsStateAndWhatWentWrong) {
  CompressedOutputStream stream(std::make_unique<NullStream>());
  EXPECT_EQ(stream.streamStatus(), StreamStatus::open);
  EXPECT_TRUE(stream.hasSpaceAvailable());
  EXPECT_EQ(stream.dataDigestForStream(), std::string(128, '0'));
  EXPECT_EQ(stream.write(std::string(5000, 'a')), 5000);
  stream.close();
  stream.close();
  EXPECT_EQ(stream.streamStatus(), StreamStatus::atEnd);
  EXPECT_EQ(stream.write("more"), -1);
  EXPECT_FALSE(stream.streamError());
  const auto compressed = dynamic_cast<NullStream&>(stream.outputStream()).bytesWritten();
  EXPECT_GT(compressed, 4u);
  EXPECT_LT(compressed, 100u);

  std::mt19937 random(7);
  for (const std::size_t room : {0u, 5000u, 200'000u}) {
    CompressedOutputStream full(std::make_unique<Recording>(room));
    const bool written = full.writeOnce(text(random, 1u << 20)) && full.writeOnce("{}");
    full.close();
    EXPECT_FALSE(written) << room;
    EXPECT_EQ(full.streamStatus(), StreamStatus::error);
    EXPECT_EQ(full.write("more"), -1);
    ASSERT_TRUE(full.streamError());
    EXPECT_EQ(full.streamError()->code, ENOSPC);
    EXPECT_EQ(full.streamError()->domain, kPOSIXErrorDomain);
  }
}

}  // namespace
}  // namespace sable::test
