#include "quarn_d_utils/codec.h"

#include <gtest/gtest.h>
#include <zlib.h>

#include <cerrno>
#include <cstdlib>
#include <fstream>
#include <random>
#include <string>
#include <vector>

#include "fault.h"
#include "log_capture.h"
#include "noise.h"

namespace {

constexpr std::size_t kKiB = 1024;
constexpr std::size_t kMiB = 1024 * kKiB;

/** Gives a text in pieces of at most @p piece bytes; fails once @p fail_at bytes were given. */
class TextSource : public ByteSource {
 public:
  explicit TextSource(const std::string &text, std::size_t piece = SIZE_MAX,
                      std::size_t fail_at = SIZE_MAX)
      : text_(text), piece_(piece), fail_at_(fail_at) {}
  long read(unsigned char *data, std::size_t size, bool *end) override {
    if (at_ >= fail_at_) return -1;
    const std::size_t count =
        text_.copy(reinterpret_cast<char *>(data), std::min(size, piece_), at_);
    at_ += count;
    *end = at_ == text_.size() && fail_at_ > text_.size();
    return static_cast<long>(count);
  }

 private:
  const std::string &text_;
  std::size_t piece_;
  std::size_t fail_at_;
  std::size_t at_ = 0;
};

/** Keeps what it gets, until it had @p limit bytes. */
class TextSink : public ByteSink {
 public:
  explicit TextSink(std::size_t limit = SIZE_MAX) : limit_(limit) {}
  bool write(const unsigned char *data, std::size_t size) override {
    if (text.size() + size > limit_) return false;
    text.append(reinterpret_cast<const char *>(data), size);
    return true;
  }
  std::string text;

 private:
  std::size_t limit_;
};

std::string words(std::size_t size) {
  std::string text;
  for (unsigned int i = 0; text.size() < size; ++i) {
    text += "line " + std::to_string(i * 2654435761U) + " of a note\n";
  }
  text.resize(size);
  return text;
}

std::uint32_t crc_of(const std::string &text) {
  return static_cast<std::uint32_t>(
      crc32_z(0, reinterpret_cast<const unsigned char *>(text.data()), text.size()));
}

struct Kind {
  const char *name;
  std::unique_ptr<Codec> (*make)(CodecUse);
  std::uint32_t (*crc32)(std::uint32_t, const void *, std::size_t);
  const char *deflate; /**< the library's calls, for faults */
};
constexpr Kind kIsal{"Isal", &make_isal_codec, &isal_codec_crc32, "isal_deflate"};
constexpr Kind kZlib{"Zlib", &make_zlib_codec, &zlib_codec_crc32, "deflate"};

std::string deflated_by(const Kind &kind, const std::string &plain) {
  TextSource source(plain);
  TextSink sink;
  CodecTotals totals;
  EXPECT_EQ(kind.make(CodecUse::kDeflate)->deflate(&source, &sink, &totals), CodecResult::kDone);
  return sink.text;
}

class CodecTest : public ::testing::TestWithParam<Kind> {
 protected:
  std::unique_ptr<Codec> make(CodecUse use) const { return GetParam().make(use); }

  CodecResult deflate(const std::string &plain, std::size_t piece = SIZE_MAX) {
    TextSource source(plain, piece);
    sink_ = TextSink();
    return deflater_->deflate(&source, &sink_, &totals_);
  }
  CodecResult inflate(const std::string &deflated, std::size_t limit = SIZE_MAX,
                      std::size_t piece = SIZE_MAX) {
    TextSource source(deflated, piece);
    sink_ = TextSink(limit);
    return inflater_->inflate(&source, &sink_, &totals_);
  }

  std::unique_ptr<Codec> deflater_ = make(CodecUse::kDeflate);
  std::unique_ptr<Codec> inflater_ = make(CodecUse::kInflate);
  TextSink sink_;
  CodecTotals totals_;
};

INSTANTIATE_TEST_SUITE_P(Both, CodecTest, ::testing::Values(kIsal, kZlib),
                         [](const auto &info) { return info.param.name; });

TEST_P(CodecTest, GivesBackWhatItTookAtEverySize) {
  for (const std::size_t size :
       {std::size_t{0}, std::size_t{1}, 64 * kKiB - 1, 64 * kKiB, 192 * kKiB - 1, 192 * kKiB,
        192 * kKiB + 1, 256 * kKiB - 1, 256 * kKiB, 256 * kKiB + 1, kMiB + 3}) {
    for (const std::string &plain : {std::string(size, '\0'), words(size), noise(size)}) {
      ASSERT_EQ(deflate(plain), CodecResult::kDone) << size;
      EXPECT_EQ(totals_.plain, size);
      EXPECT_EQ(totals_.deflated, sink_.text.size());
      EXPECT_EQ(totals_.crc, crc_of(plain));
      const std::string deflated = sink_.text;
      ASSERT_EQ(inflate(deflated), CodecResult::kDone) << size;
      EXPECT_TRUE(sink_.text == plain) << size;
      EXPECT_EQ(totals_.plain, size);
      EXPECT_EQ(totals_.deflated, deflated.size());
      EXPECT_EQ(totals_.crc, crc_of(plain));
    }
  }
}

TEST_P(CodecTest, ReadsWhatTheOtherWrote) {
  for (const Kind &writer : {kIsal, kZlib}) {
    for (const std::string &plain : {std::string(), words(600 * kKiB), noise(300 * kKiB)}) {
      ASSERT_EQ(inflate(deflated_by(writer, plain)), CodecResult::kDone) << writer.name;
      EXPECT_TRUE(sink_.text == plain) << writer.name;
    }
  }
}

TEST_P(CodecTest, MakesTextSmallAndNoiseHardlyLarger) {
  ASSERT_EQ(deflate(words(kMiB)), CodecResult::kDone);
  EXPECT_LT(sink_.text.size(), kMiB / 2);
  ASSERT_EQ(deflate(noise(kMiB)), CodecResult::kDone);
  EXPECT_LT(sink_.text.size(), kMiB + kMiB / 1000);
}

TEST_P(CodecTest, TheSameInputGivesTheSameOutput) {
  const std::string plain = words(700 * kKiB);
  const std::string first = deflated_by(GetParam(), plain);
  EXPECT_TRUE(deflated_by(GetParam(), plain) == first);
  ASSERT_EQ(deflate(noise(1000)), CodecResult::kDone);
  ASSERT_EQ(deflate(plain), CodecResult::kDone);
  EXPECT_TRUE(sink_.text == first) << "an entry before changes nothing";
}

TEST_P(CodecTest, TakesASourceThatGivesLittle) {
  const std::string plain = words(20 * kKiB);
  ASSERT_EQ(deflate(plain, 1), CodecResult::kDone);
  EXPECT_EQ(totals_.crc, crc_of(plain));
  const std::string deflated = sink_.text;
  ASSERT_EQ(inflate(deflated, SIZE_MAX, 1), CodecResult::kDone);
  EXPECT_TRUE(sink_.text == plain);
}

TEST_P(CodecTest, WhatWasReadBeforeASourceFailedIsWhole) {
  const std::string plain = words(600 * kKiB);
  TextSource source(plain, SIZE_MAX, 1);
  TextSink sink;
  CodecTotals totals;
  EXPECT_EQ(deflater_->deflate(&source, &sink, &totals), CodecResult::kSourceFailed);
  EXPECT_GT(totals.plain, 0U);
  EXPECT_EQ(totals.deflated, sink.text.size());
  ASSERT_EQ(inflate(sink.text), CodecResult::kDone);
  EXPECT_TRUE(sink_.text == plain.substr(0, totals.plain));
  EXPECT_EQ(totals_.crc, totals.crc);
}

TEST_P(CodecTest, AFailedSourceEndsInflating) {
  const std::string deflated = deflated_by(GetParam(), noise(300 * kKiB));
  TextSource source(deflated, SIZE_MAX, 1);
  TextSink sink;
  CodecTotals totals;
  EXPECT_EQ(inflater_->inflate(&source, &sink, &totals), CodecResult::kSourceFailed);
}

TEST_P(CodecTest, AFailedSinkEndsBothWays) {
  const std::string plain = noise(600 * kKiB);
  TextSource source(plain);
  TextSink full(100 * kKiB);
  CodecTotals totals;
  EXPECT_EQ(deflater_->deflate(&source, &full, &totals), CodecResult::kSinkFailed);
  EXPECT_EQ(inflate(deflated_by(GetParam(), plain), 0), CodecResult::kSinkFailed);
  EXPECT_EQ(inflate(deflated_by(GetParam(), plain), 300 * kKiB), CodecResult::kSinkFailed);
}

TEST_P(CodecTest, WorksAfterEveryFailure) {
  const std::string plain = words(300 * kKiB);
  const std::string deflated = deflated_by(GetParam(), plain);
  TextSource failing(plain, SIZE_MAX, 1);
  TextSink full(0);
  CodecTotals totals;
  deflater_->deflate(&failing, &full, &totals);
  ASSERT_EQ(deflate(plain), CodecResult::kDone);
  EXPECT_TRUE(sink_.text == deflated);
  EXPECT_EQ(inflate("\xff\xff\xff garbage"), CodecResult::kCorrupt);
  EXPECT_EQ(inflate(deflated, 0), CodecResult::kSinkFailed);
  ASSERT_EQ(inflate(deflated), CodecResult::kDone);
  EXPECT_TRUE(sink_.text == plain);
}

TEST_P(CodecTest, DataThatIsNotDeflateIsCorrupt) {
  EXPECT_EQ(inflate("\x07 a reserved block type"), CodecResult::kCorrupt);
  EXPECT_EQ(inflate(std::string("\x01\x05\x00\x00\x00", 5) + "hello"), CodecResult::kCorrupt)
      << "the length of a stored block does not match its complement";
  EXPECT_EQ(inflate(""), CodecResult::kCorrupt);
}

TEST_P(CodecTest, EveryCutOffStreamIsCorrupt) {
  const std::string plain = words(3000);
  const std::string deflated = deflated_by(GetParam(), plain);
  for (std::size_t length = 0; length < deflated.size(); ++length) {
    ASSERT_EQ(inflate(deflated.substr(0, length)), CodecResult::kCorrupt) << length;
    ASSERT_TRUE(plain.compare(0, sink_.text.size(), sink_.text) == 0) << length;
  }
}

TEST_P(CodecTest, WhatFollowsTheStreamIsNoPartOfIt) {
  const std::string plain = words(3000);
  ASSERT_EQ(inflate(deflated_by(GetParam(), plain) + "something else"), CodecResult::kDone);
  EXPECT_TRUE(sink_.text == plain);
}

TEST_P(CodecTest, ABombOfZerosEndsWhereItsSinkSays) {
  const std::string bomb = deflated_by(GetParam(), std::string(32 * kMiB, '\0'));
  EXPECT_LT(bomb.size(), 512 * kKiB);
  EXPECT_EQ(inflate(bomb, kMiB), CodecResult::kSinkFailed);
  EXPECT_LE(sink_.text.size(), kMiB);
}

TEST_P(CodecTest, ALibraryThatRefusesIsAnError) {
  const Fault fault(GetParam().deflate, 0);
  EXPECT_EQ(deflate("text"), CodecResult::kCorrupt);
  EXPECT_EQ(fault.hits(), 1);
}

TEST_P(CodecTest, IsNullWhenMemoryIsOut) {
  for (const CodecUse use : {CodecUse::kDeflate, CodecUse::kInflate}) {
    const Fault fault("new", ENOMEM);
    EXPECT_EQ(make(use), nullptr);
    EXPECT_EQ(fault.hits(), 1);
  }
}

TEST_P(CodecTest, CountsTheChecksumOfTheStandard) {
  const std::string text = "123456789";
  EXPECT_EQ(GetParam().crc32(0, text.data(), text.size()), 0xcbf43926U);
  EXPECT_EQ(GetParam().crc32(GetParam().crc32(0, text.data(), 4), text.data() + 4, 5), 0xcbf43926U);
  EXPECT_EQ(GetParam().crc32(0, "", 0), 0U);
  EXPECT_EQ(GetParam().crc32(17, "", 0), 17U);
}

TEST(IsalCodec, CountsTheArchiveLibrarysChecksumsToo) {
  const std::string text = words(1000);
  const auto *bytes = reinterpret_cast<const unsigned char *>(text.data());
  const uLong first = crc32(0, bytes, 300);
  EXPECT_EQ(crc32(first, bytes + 300, 700), crc32_z(0, bytes, 1000));
  EXPECT_EQ(crc32(first, nullptr, 0), crc32_z(0, nullptr, 0));
}

TEST(IsalCodec, StoresWhatCannotBeCompressed) {
  // 5 bytes for each block of at most 64 KiB, and a little at the end of a chunk of three
  const std::string plain = noise(4 * kMiB);
  EXPECT_LT(deflated_by(kIsal, plain).size(), plain.size() + plain.size() / 3000);
}

TEST(IsalCodec, TheSmallestFilesHaveTheFixedCodeAndAreHardlyLarger) {
  constexpr unsigned char kBlockKind = 0x06;  // RFC 1951, 3.2.3: the two bits behind the first
  constexpr unsigned char kFixed = 0x02;
  constexpr unsigned char kOwn = 0x04;
  const auto codec = make_isal_codec(CodecUse::kDeflate);
  // one after the other: a small file leaves nothing behind for a larger one
  for (const std::size_t size : {std::size_t{1536}, std::size_t{1537}, std::size_t{100}, kMiB}) {
    const std::string plain = words(size);
    TextSource source(plain);
    TextSink sink;
    CodecTotals totals;
    ASSERT_EQ(codec->deflate(&source, &sink, &totals), CodecResult::kDone);
    const auto kind = static_cast<unsigned char>(sink.text[0]) & kBlockKind;
    EXPECT_EQ(kind, size <= 1536 ? kFixed : kOwn) << size;
    EXPECT_EQ(sink.text, deflated_by(kIsal, plain)) << size;
  }
  EXPECT_LT(deflated_by(kIsal, noise(1536)).size(), 1536U * 107 / 100);
}

TEST(IsalCodec, HowTheSourceCutsItsBytesDoesNotShow) {
  const std::string plain = words(500 * kKiB);
  TextSource source(plain, 1000);
  TextSink sink;
  CodecTotals totals;
  ASSERT_EQ(make_isal_codec(CodecUse::kDeflate)->deflate(&source, &sink, &totals),
            CodecResult::kDone);
  EXPECT_TRUE(sink.text == deflated_by(kIsal, plain));
}

TEST(IsalCodec, TakesAnyMemoryWhereItsPlacesAreTaken) {
  const std::string plain = words(300 * kKiB);
  const Fault fault("mmap", ENOMEM, 0, 1000);
  clear_captured_log();
  const std::string deflated = deflated_by(kIsal, plain);
  EXPECT_EQ(count_logged(DLOG_WARN,
                         "the codec's memory has none of its places: the same data may "
                         "be uploaded again"),
            1);
  TextSource source(deflated);
  TextSink sink;
  CodecTotals totals;
  EXPECT_EQ(make_isal_codec(CodecUse::kInflate)->inflate(&source, &sink, &totals),
            CodecResult::kDone);
  EXPECT_TRUE(sink.text == plain);
}

/** Where the process has memory that anybody could foretell. */
bool has_memory_at_a_fixed_place() {
  std::ifstream maps("/proc/self/maps");
  for (std::string line; std::getline(maps, line);) {
    const unsigned long start = std::strtoul(line.c_str(), nullptr, 16);
    if (start >= 0x200000000000UL && start < 0x200010000000UL) return true;
  }
  return false;
}

TEST(IsalCodec, WhatAServerHasSentLiesAtNoFixedPlace) {
  const std::unique_ptr<Codec> codec = make_isal_codec(CodecUse::kInflate);
  ASSERT_NE(codec, nullptr);
  EXPECT_FALSE(has_memory_at_a_fixed_place());
}

TEST(IsalCodec, NothingStaysAtAFixedPlaceOnceAnArchiveIsMade) {
  ASSERT_NE(make_isal_codec(CodecUse::kDeflate), nullptr);
  EXPECT_FALSE(has_memory_at_a_fixed_place());
}

TEST(IsalCodec, IsNullWhenThereIsNoMemoryAtAll) {
  // no place is left to map, and then the allocation fails
  std::vector<std::unique_ptr<Codec>> holders;
  for (int i = 0; i < 16; ++i) holders.push_back(make_isal_codec(CodecUse::kDeflate));
  const Fault fault("calloc", ENOMEM);
  EXPECT_EQ(make_isal_codec(CodecUse::kDeflate), nullptr);
  EXPECT_EQ(fault.hits(), 1);
}

TEST(IsalCodec, TwoAtATimeMakeTheSame) {
  const std::string plain = words(300 * kKiB);
  const std::string alone = deflated_by(kIsal, plain);
  const std::unique_ptr<Codec> other = make_isal_codec(CodecUse::kDeflate);
  EXPECT_TRUE(deflated_by(kIsal, plain) == alone);
}

TEST(ZlibCodec, IsNullWithoutItsBuffers) {
  const Fault fault("calloc", ENOMEM);
  EXPECT_EQ(make_zlib_codec(CodecUse::kDeflate), nullptr);
  EXPECT_EQ(fault.hits(), 1);
}

TEST(ZlibCodec, IsNullWhenTheLibraryHasNoMemory) {
  for (const auto &[use, call] : {std::pair(CodecUse::kDeflate, "deflateInit2_"),
                                  std::pair(CodecUse::kInflate, "inflateInit2_")}) {
    const Fault fault(call, ENOMEM);
    EXPECT_EQ(make_zlib_codec(use), nullptr);
    EXPECT_EQ(fault.hits(), 1);
  }
}

}  // namespace
