#include <isa-l/crc.h>
#include <isa-l/igzip_lib.h>
#include <sys/mman.h>
#include <zlib.h>

#include <cstdlib>
#include <new>

#include "quarn_d_utils/codec.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"

namespace {

// level 2 costs what level 1 costs, and makes smaller archives than zlib's level 1
constexpr std::uint32_t kLevel = 2;
// The library stores what it cannot compress only when a block's input and output both lie within
// one call. Blocks therefore end with their chunk, and a chunk's output fits beside it.
constexpr std::size_t kPlainChunk = 192U << 10;
constexpr std::size_t kDeflatedChunk = 200U << 10;
constexpr std::size_t kInflateInput = 64U << 10;
constexpr std::size_t kInflateOutput = 256U << 10;

// Making a code for a file takes as long as finding the matches in 2 KiB of it. The smallest files
// are written in the format's fixed code, which only the level without codes of its own takes: of
// 2,000 files of up to 8 KiB a fortieth of the CPU time, for an archive that is 1.1 % larger.
constexpr std::size_t kSmallest = 1536;
constexpr std::uint32_t kFixedCodeLevel = 0;

struct DeflateMemory {
  isal_zstream stream;
  unsigned char level[ISAL_DEF_LVL2_DEFAULT];
  unsigned char plain[kPlainChunk];
  unsigned char deflated[kDeflatedChunk];
};

struct InflateMemory {
  inflate_state state;
  unsigned char deflated[kInflateInput];
  unsigned char plain[kInflateOutput];
};

static_assert(sizeof(DeflateMemory) <= kCodecMemory && sizeof(InflateMemory) <= kCodecMemory,
              "the bound on the codec's memory");

// The library's output depends, rarely and by a byte or two, on where its memory lies (measured:
// one process in forty differs under address randomisation, none of 900 at a fixed address). An
// archive that differs would be uploaded again, so what deflates lies at one of a few fixed places.
// Where they are taken, or are no addresses, any memory does, which is told. What inflates, and
// holds what a server has sent, lies where the system likes: its output is the data.
constexpr std::uint64_t kFirstPlace = 0x200000000000;
constexpr std::uint64_t kPlaceDistance = 16U << 20;
constexpr int kPlaces = 16;

void *map_at_fixed_place([[maybe_unused]] std::size_t size) {
#if defined(__SANITIZE_THREAD__)
  // The thread sanitizer keeps these addresses to itself, and ends a process that maps them.
  return nullptr;
#else
  if (sizeof(void *) < sizeof(kFirstPlace)) return nullptr;
  for (int i = 0; i < kPlaces; ++i) {
    auto *place = reinterpret_cast<void *>(
        static_cast<std::uintptr_t>(kFirstPlace + static_cast<std::uint64_t>(i) * kPlaceDistance));
    void *mapped = mmap(place, size, PROT_READ | PROT_WRITE,
                        MAP_PRIVATE | MAP_ANONYMOUS | MAP_FIXED_NOREPLACE, -1, 0);
    if (mapped == place) return mapped;
    // a kernel that does not know the flag takes the address for a hint
    if (mapped != MAP_FAILED) munmap(mapped, size);
  }
  return nullptr;
#endif
}

void *map_anywhere(std::size_t size) {
  void *const mapped =
      mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  return mapped == MAP_FAILED ? nullptr : mapped;
}

/** Zeroed memory for a T, or null. */
template <typename T>
class CodecMemory {
 public:
  CodecMemory(bool wanted, void *(*map)(std::size_t size)) {
    if (!wanted) return;
    mapped_ = static_cast<T *>(map(sizeof(T)));
    if (mapped_ == nullptr) allocated_.reset(static_cast<T *>(std::calloc(1, sizeof(T))));
  }
  ~CodecMemory() {
    if (mapped_ != nullptr) munmap(mapped_, sizeof(T));
  }
  CodecMemory(const CodecMemory &) = delete;
  CodecMemory &operator=(const CodecMemory &) = delete;

  bool is_mapped() const { return mapped_ != nullptr; }
  T *get() const { return mapped_ != nullptr ? mapped_ : allocated_.get(); }
  T *operator->() const { return get(); }
  bool operator!=(std::nullptr_t) const { return get() != nullptr; }

 private:
  T *mapped_ = nullptr;
  Handle<T, &std::free> allocated_;
};

class IsalCodec : public Codec {
 public:
  explicit IsalCodec(CodecUse use)
      : out_(use == CodecUse::kDeflate, map_at_fixed_place),
        in_(use == CodecUse::kInflate, map_anywhere) {
    if (out_ != nullptr) {
      if (!out_.is_mapped()) {
        LOGW("the codec's memory has none of its places: the same data may be uploaded again");
      }
      isal_deflate_init(&out_->stream);
      out_->stream.level = kLevel;
      out_->stream.level_buf = out_->level;
      out_->stream.level_buf_size = sizeof(out_->level);
      out_->stream.gzip_flag = IGZIP_DEFLATE;
      out_->stream.flush = NO_FLUSH;
    }
    if (in_ != nullptr) isal_inflate_init(&in_->state);
  }

  bool ready() const { return out_ != nullptr || in_ != nullptr; }

  CodecResult deflate(ByteSource *source, ByteSink *sink, CodecTotals *totals) override {
    isal_zstream &stream = out_->stream;
    *totals = {};
    CodecResult result = CodecResult::kDone;
    bool end = false;
    std::size_t count = fill(source, &end, &result);
    start_stream(end && count > 0 && count <= kSmallest);
    for (;; count = fill(source, &end, &result)) {
      totals->crc = isal_codec_crc32(totals->crc, out_->plain, count);
      totals->plain += count;
      stream.next_in = out_->plain;
      stream.avail_in = static_cast<std::uint32_t>(count);
      stream.end_of_stream = end ? 1 : 0;
      stream.flush = end ? NO_FLUSH : SYNC_FLUSH;
      do {
        stream.next_out = out_->deflated;
        stream.avail_out = kDeflatedChunk;
        if (isal_deflate(&stream) != COMP_OK) return CodecResult::kCorrupt;
        const std::size_t made = kDeflatedChunk - stream.avail_out;
        if (made > 0 && !sink->write(out_->deflated, made)) return CodecResult::kSinkFailed;
        totals->deflated += made;
      } while (stream.avail_out == 0 && stream.internal_state.state != ZSTATE_END);
      if (end) return result;
    }
  }

  CodecResult inflate(ByteSource *source, ByteSink *sink, CodecTotals *totals) override {
    inflate_state &state = in_->state;
    isal_inflate_reset(&state);
    state.crc_flag = ISAL_DEFLATE;
    state.avail_in = 0;
    *totals = {};
    bool end = false;
    start_output(&state);
    for (;;) {
      if (state.avail_in == 0 && !end && !refill(source, &end, totals)) {
        return CodecResult::kSourceFailed;
      }
      const std::uint32_t before_in = state.avail_in;
      const std::uint32_t before_out = state.avail_out;
      if (isal_inflate(&state) < ISAL_DECOMP_OK) return CodecResult::kCorrupt;
      if (before_in > 0 && state.avail_in == before_in && state.avail_out == before_out) {
        return CodecResult::kCorrupt;
      }
      const bool finished = state.block_state == ISAL_BLOCK_FINISH;
      const bool cut_off = !finished && end && state.avail_in == 0 && state.avail_out > 0;
      if (state.avail_out > 0 && !finished && !cut_off) continue;
      const std::size_t made = kInflateOutput - state.avail_out;
      totals->crc = isal_codec_crc32(totals->crc, in_->plain, made);
      totals->plain += made;
      if (made > 0 && !sink->write(in_->plain, made)) return CodecResult::kSinkFailed;
      if (cut_off) return CodecResult::kCorrupt;
      if (finished) return CodecResult::kDone;
      start_output(&state);
    }
  }

 private:
  void start_stream(bool fixed_code) {
    isal_deflate_reset(&out_->stream);
    out_->stream.level = fixed_code ? kFixedCodeLevel : kLevel;
    if (fixed_code) isal_deflate_set_hufftables(&out_->stream, nullptr, IGZIP_HUFFTABLE_STATIC);
  }
  /** What is inflated next. @return false when the source fails */
  bool refill(ByteSource *source, bool *end, CodecTotals *totals) {
    const long count = source->read(in_->deflated, kInflateInput, end);
    if (count < 0) return false;
    if (count == 0) *end = true;
    totals->deflated += static_cast<std::uint64_t>(count);
    in_->state.next_in = in_->deflated;
    in_->state.avail_in = static_cast<std::uint32_t>(count);
    return true;
  }
  /** The next chunk, full unless the source ends: its bounds decide what the output is. */
  std::size_t fill(ByteSource *source, bool *end, CodecResult *result) {
    std::size_t filled = 0;
    while (filled < kPlainChunk && !*end) {
      const long count = source->read(out_->plain + filled, kPlainChunk - filled, end);
      if (count < 0) *result = CodecResult::kSourceFailed;
      if (count <= 0) *end = true;
      if (count > 0) filled += static_cast<std::size_t>(count);
    }
    return filled;
  }
  void start_output(inflate_state *state) {
    state->next_out = in_->plain;
    state->avail_out = kInflateOutput;
  }

  CodecMemory<DeflateMemory> out_;
  CodecMemory<InflateMemory> in_;
};

}  // namespace

std::unique_ptr<Codec> make_isal_codec(CodecUse use) {
  std::unique_ptr<IsalCodec> codec(new (std::nothrow) IsalCodec(use));
  if (codec == nullptr || !codec->ready()) return nullptr;
  return codec;
}

std::uint32_t isal_codec_crc32(std::uint32_t crc, const void *data, std::size_t size) {
  return crc32_gzip_refl(crc, static_cast<const unsigned char *>(data), size);
}

/**
 * minizip counts a checksum of the compressed bytes that nobody asked for. It takes this function
 * in place of zlib's, which needs several times as long for the same number.
 */
extern "C" uLong crc32(uLong crc, const Bytef *data, uInt size) {
  return data == nullptr ? 0 : isal_codec_crc32(static_cast<std::uint32_t>(crc), data, size);
}
