/**
 * @file codec.h
 * @brief Raw deflate for the archives: one interface, one implementation per build.
 *
 * A codec holds its state and buffers and uses them for one entry after the
 * other; together they stay below kCodecMemory. One thread at a time.
 */
#ifndef QUARN_D_UTILS_CODEC_H
#define QUARN_D_UTILS_CODEC_H

#include <cstddef>
#include <cstdint>
#include <memory>

/** Most that a codec takes from the heap, bytes. */
inline constexpr std::size_t kCodecMemory = 832U << 10;

/** Where a codec's input comes from. */
class ByteSource {
 public:
  virtual ~ByteSource() = default;
  /**
   * Fill at most @p size bytes.
   * @param[out] end set when nothing follows the bytes returned
   * @return their number, -1 on failure
   */
  [[nodiscard]] virtual long read(unsigned char *data, std::size_t size, bool *end) = 0;
};

/** Where its output goes. */
class ByteSink {
 public:
  virtual ~ByteSink() = default;
  /** @return false to end the entry here */
  [[nodiscard]] virtual bool write(const unsigned char *data, std::size_t size) = 0;
};

enum class CodecResult {
  kDone,
  kSourceFailed, /**< deflate: the output is whole and holds what was read before */
  kSinkFailed,
  kCorrupt, /**< inflate: not deflate data, or cut off */
};

/** What one entry came to. */
struct CodecTotals {
  std::uint64_t plain = 0;    /**< bytes not compressed */
  std::uint64_t deflated = 0; /**< bytes compressed */
  std::uint32_t crc = 0;      /**< CRC-32 of the plain bytes */
};

class Codec {
 public:
  Codec() = default;
  virtual ~Codec() = default;
  Codec(const Codec &) = delete;
  Codec &operator=(const Codec &) = delete;

  /** Compress everything that @p source gives. The same input gives the same output. */
  [[nodiscard]] virtual CodecResult deflate(ByteSource *source, ByteSink *sink,
                                            CodecTotals *totals) = 0;
  /** Decompress one deflate stream; what follows it is not read. */
  [[nodiscard]] virtual CodecResult inflate(ByteSource *source, ByteSink *sink,
                                            CodecTotals *totals) = 0;
};

/** What the codec is wanted for: each direction has its own state. */
enum class CodecUse { kDeflate, kInflate };

/** Null when memory is out. */
[[nodiscard]] std::unique_ptr<Codec> make_isal_codec(CodecUse use);
[[nodiscard]] std::unique_ptr<Codec> make_zlib_codec(CodecUse use);
/** CRC-32 (IEEE 802.3, as zlib counts it) of @p data after bytes with @p crc; 0 to start. */
[[nodiscard]] std::uint32_t isal_codec_crc32(std::uint32_t crc, const void *data, std::size_t size);
[[nodiscard]] std::uint32_t zlib_codec_crc32(std::uint32_t crc, const void *data, std::size_t size);

/** The codec that this build is configured with; a test may define one of its own. */
[[nodiscard]] std::unique_ptr<Codec> make_codec(CodecUse use);

#ifdef QUARN_CODEC_ZLIB
[[nodiscard]] inline std::uint32_t codec_crc32(std::uint32_t crc, const void *data,
                                               std::size_t size) {
  return zlib_codec_crc32(crc, data, size);
}
#else
/** CRC-32 as that codec counts it. */
[[nodiscard]] inline std::uint32_t codec_crc32(std::uint32_t crc, const void *data,
                                               std::size_t size) {
  return isal_codec_crc32(crc, data, size);
}
#endif

#endif
