#include "core/checksum.h"

#include <dlfcn.h>
#include <gtest/gtest.h>

namespace transport {
namespace {

struct Sums {
  std::string md5;
  std::string sha256;
  bool operator==(const Sums &other) const { return md5 == other.md5 && sha256 == other.sha256; }
};

std::string sum(GChecksumType type, const std::string &text) {
  Checksum checksum(type);
  const std::size_t half = text.size() / 2;
  checksum.add(text.data(), half);
  checksum.add(text.data() + half, text.size() - half);
  const std::string hex = checksum.hex();
  EXPECT_EQ(checksum.hex(), hex);
  return hex;
}

Sums sums(const std::string &text) {
  return {sum(G_CHECKSUM_MD5, text), sum(G_CHECKSUM_SHA256, text)};
}

TEST(ChecksumTest, IsTheSameWithAndWithoutTheLibrary) {
  const std::string texts[] = {"", "abc", std::string(1000003, 'x')};
  // The test vectors of RFC 1321, A.5, and FIPS 180-4.
  const Sums abc = {"900150983cd24fb0d6963f7d28e17f72",
                    "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad"};
  std::vector<Sums> before;
  for (const std::string &text : texts) before.push_back(sums(text));
  EXPECT_EQ(before[1], abc);
  void *none = dlopen("libz.so.1", RTLD_NOW | RTLD_LOCAL);
  ASSERT_NE(none, nullptr);
  count_checksums_with(none);
  EXPECT_EQ(sums("abc"), abc);
  void *library = dlopen("libcrypto.so.3", RTLD_NOW | RTLD_LOCAL);
  ASSERT_NE(library, nullptr);
  count_checksums_with(library);
  for (std::size_t i = 0; i < before.size(); ++i) EXPECT_EQ(sums(texts[i]), before[i]);
}

TEST(ChecksumTest, MayBeGivenUpHalfway) {
  Checksum checksum(G_CHECKSUM_SHA256);
  checksum.add("text", 4);
}

}  // namespace
}  // namespace transport
