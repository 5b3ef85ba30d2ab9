#include "quarn_d_utils/codec.h"

std::unique_ptr<Codec> make_codec(CodecUse use) {
#ifdef QUARN_CODEC_ZLIB
  return make_zlib_codec(use);
#else
  return make_isal_codec(use);
#endif
}
