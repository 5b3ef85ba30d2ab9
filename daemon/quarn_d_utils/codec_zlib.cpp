#include <zlib.h>

#include <cstdlib>
#include <new>

#include "quarn_d_utils/codec.h"
#include "quarn_d_utils/handles.h"

namespace {

constexpr int kRawWindow = -15;  // negative: no zlib header
constexpr int kMemoryLevel = 8;
constexpr std::size_t kPlainChunk = 256U << 10;
constexpr std::size_t kDeflatedChunk = 64U << 10;

struct Buffers {
  unsigned char plain[kPlainChunk];
  unsigned char deflated[kDeflatedChunk];
};

// what zlib itself takes for these settings: 264 KiB, or 40 KiB to inflate
constexpr std::size_t kZlibMemory = 272U << 10;
static_assert(sizeof(Buffers) + kZlibMemory <= kCodecMemory, "the bound on the codec's memory");

class ZlibCodec : public Codec {
 public:
  explicit ZlibCodec(CodecUse use)
      : use_(use), buffers_(static_cast<Buffers *>(std::calloc(1, sizeof(Buffers)))) {
    if (buffers_ == nullptr) return;
    const int result = use == CodecUse::kDeflate
                           ? deflateInit2(&stream_, Z_BEST_SPEED, Z_DEFLATED, kRawWindow,
                                          kMemoryLevel, Z_DEFAULT_STRATEGY)
                           : inflateInit2(&stream_, kRawWindow);
    ready_ = result == Z_OK;
  }
  ~ZlibCodec() override {
    if (!ready_) return;
    if (use_ == CodecUse::kDeflate) {
      deflateEnd(&stream_);
    } else {
      inflateEnd(&stream_);
    }
  }

  bool ready() const { return ready_; }

  CodecResult deflate(ByteSource *source, ByteSink *sink, CodecTotals *totals) override {
    deflateReset(&stream_);
    *totals = {};
    CodecResult result = CodecResult::kDone;
    bool end = false;
    stream_.avail_in = 0;
    start_output(buffers_->deflated, kDeflatedChunk);
    for (;;) {
      if (stream_.avail_in == 0 && !end) {
        long count = source->read(buffers_->plain, kPlainChunk, &end);
        if (count < 0) {
          result = CodecResult::kSourceFailed;
          count = 0;
        }
        if (count == 0) end = true;
        totals->crc =
            zlib_codec_crc32(totals->crc, buffers_->plain, static_cast<std::size_t>(count));
        totals->plain += static_cast<std::uint64_t>(count);
        stream_.next_in = buffers_->plain;
        stream_.avail_in = static_cast<uInt>(count);
      }
      const int status = ::deflate(&stream_, end ? Z_FINISH : Z_NO_FLUSH);
      if (status == Z_STREAM_ERROR) return CodecResult::kCorrupt;
      const bool finished = status == Z_STREAM_END;
      if (stream_.avail_out > 0 && !finished) continue;
      const std::size_t made = kDeflatedChunk - stream_.avail_out;
      if (made > 0 && !sink->write(buffers_->deflated, made)) return CodecResult::kSinkFailed;
      totals->deflated += made;
      if (finished) return result;
      start_output(buffers_->deflated, kDeflatedChunk);
    }
  }

  CodecResult inflate(ByteSource *source, ByteSink *sink, CodecTotals *totals) override {
    inflateReset(&stream_);
    *totals = {};
    bool end = false;
    stream_.avail_in = 0;
    start_output(buffers_->plain, kPlainChunk);
    for (;;) {
      if (stream_.avail_in == 0 && !end) {
        const long count = source->read(buffers_->deflated, kDeflatedChunk, &end);
        if (count < 0) return CodecResult::kSourceFailed;
        if (count == 0) end = true;
        totals->deflated += static_cast<std::uint64_t>(count);
        stream_.next_in = buffers_->deflated;
        stream_.avail_in = static_cast<uInt>(count);
      }
      const int status = ::inflate(&stream_, Z_NO_FLUSH);
      const bool finished = status == Z_STREAM_END;
      if (!finished && status != Z_OK && status != Z_BUF_ERROR) return CodecResult::kCorrupt;
      const bool cut_off = !finished && end && stream_.avail_in == 0 && stream_.avail_out > 0;
      if (stream_.avail_out > 0 && !finished && !cut_off) continue;
      const std::size_t made = kPlainChunk - stream_.avail_out;
      totals->crc = zlib_codec_crc32(totals->crc, buffers_->plain, made);
      totals->plain += made;
      if (made > 0 && !sink->write(buffers_->plain, made)) return CodecResult::kSinkFailed;
      if (cut_off) return CodecResult::kCorrupt;
      if (finished) return CodecResult::kDone;
      start_output(buffers_->plain, kPlainChunk);
    }
  }

 private:
  void start_output(unsigned char *data, std::size_t size) {
    stream_.next_out = data;
    stream_.avail_out = static_cast<uInt>(size);
  }

  CodecUse use_;
  Handle<Buffers, &std::free> buffers_;
  z_stream stream_ = {};
  bool ready_ = false;
};

}  // namespace

std::unique_ptr<Codec> make_zlib_codec(CodecUse use) {
  std::unique_ptr<ZlibCodec> codec(new (std::nothrow) ZlibCodec(use));
  if (codec == nullptr || !codec->ready()) return nullptr;
  return codec;
}

std::uint32_t zlib_codec_crc32(std::uint32_t crc, const void *data, std::size_t size) {
  return static_cast<std::uint32_t>(crc32_z(crc, static_cast<const unsigned char *>(data), size));
}
