#include "codec_choice.h"

#include "quarn_d_utils/codec.h"

namespace {
ArchiveCodec chosen = ArchiveCodec::kIsal;

std::unique_ptr<Codec> make_chosen(CodecUse use);
}  // namespace

void choose_codec(ArchiveCodec codec) { chosen = codec; }

// The linker leads the configured codec's maker here. It keeps its own name for __real_.
#define NAME(prefix, codec, suffix) prefix #codec suffix
#define REAL(codec) NAME("__real__Z15make_", codec, "_codec8CodecUse")
#define WRAPPED(codec) NAME("__wrap__Z15make_", codec, "_codec8CodecUse")

std::unique_ptr<Codec> real_make(CodecUse use) asm(REAL(QUARN_CONFIGURED_CODEC));
std::unique_ptr<Codec> wrapped_make(CodecUse use) asm(WRAPPED(QUARN_CONFIGURED_CODEC));
std::unique_ptr<Codec> wrapped_make(CodecUse use) { return make_chosen(use); }

namespace {

std::unique_ptr<Codec> make_chosen(CodecUse use) {
  if (chosen == ArchiveCodec::kNone) return nullptr;
#ifdef QUARN_CODEC_ZLIB
  return chosen == ArchiveCodec::kZlib ? real_make(use) : make_isal_codec(use);
#else
  return chosen == ArchiveCodec::kIsal ? real_make(use) : make_zlib_codec(use);
#endif
}

}  // namespace
