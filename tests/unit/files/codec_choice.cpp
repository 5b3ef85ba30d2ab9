#include "codec_choice.h"

#include "quarn_d_utils/codec.h"

namespace {
ArchiveCodec chosen = ArchiveCodec::kIsal;
}  // namespace

void choose_codec(ArchiveCodec codec) { chosen = codec; }

// Stands for the library's, which a program with one of its own does not take.
std::unique_ptr<Codec> make_codec(CodecUse use) {
  if (chosen == ArchiveCodec::kNone) return nullptr;
  return chosen == ArchiveCodec::kZlib ? make_zlib_codec(use) : make_isal_codec(use);
}
