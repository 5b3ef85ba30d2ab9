#include "quarn_d_utils/entry_reader.h"

namespace {

constexpr int kStored = 0;

}  // namespace

bool is_stored(const unz_file_info64 &info) { return info.compression_method == kStored; }

const char *form_refusal(const unz_file_info64 &info) {
  if (info.compression_method != Z_DEFLATED && !is_stored(info)) {
    return "its compression is not known";
  }
  if ((info.flag & 1U) != 0) return "it is encrypted";
  return nullptr;
}

CodecResult copy_stored(ByteSource *source, ByteSink *sink, CodecTotals *totals) {
  constexpr std::size_t kChunk = 16U << 10;
  unsigned char chunk[kChunk];
  *totals = {};
  for (bool end = false; !end;) {
    const long count = source->read(chunk, sizeof chunk, &end);
    if (count < 0) return CodecResult::kSourceFailed;
    const auto size = static_cast<std::size_t>(count);
    totals->crc = codec_crc32(totals->crc, chunk, size);
    totals->plain += size;
    if (size > 0 && !sink->write(chunk, size)) return CodecResult::kSinkFailed;
  }
  return CodecResult::kDone;
}
