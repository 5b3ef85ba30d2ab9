#include "core/checksum.h"

#include <atomic>

#include "core/symbols.h"

namespace transport {
namespace {

constexpr std::size_t kMostBytes = 64;  // EVP_MAX_MD_SIZE
constexpr char kDigits[] = "0123456789abcdef";

/** Of <openssl/evp.h>; see EVP_DigestInit(3). Contexts and methods are opaque. */
struct Crypto {
  void *(*context_new)() = nullptr;
  void (*context_free)(void *) = nullptr;
  const void *(*md5)() = nullptr;
  const void *(*sha256)() = nullptr;
  int (*init)(void *, const void *, void *) = nullptr;
  int (*update)(void *, const void *, std::size_t) = nullptr;
  int (*final)(void *, unsigned char *, unsigned int *) = nullptr;
};

bool find_all(void *library, Crypto *crypto) {
  return find_symbol(library, "EVP_MD_CTX_new", &crypto->context_new) &&
         find_symbol(library, "EVP_MD_CTX_free", &crypto->context_free) &&
         find_symbol(library, "EVP_md5", &crypto->md5) &&
         find_symbol(library, "EVP_sha256", &crypto->sha256) &&
         find_symbol(library, "EVP_DigestInit_ex", &crypto->init) &&
         find_symbol(library, "EVP_DigestUpdate", &crypto->update) &&
         find_symbol(library, "EVP_DigestFinal_ex", &crypto->final);
}

/** Null while nobody has loaded it. */
std::atomic<const Crypto *> loaded_crypto{nullptr};

}  // namespace

void count_checksums_with(void *library) {
  auto crypto = std::make_unique<Crypto>();
  // Kept for good, as the library is.
  if (find_all(library, crypto.get())) loaded_crypto = crypto.release();
}

Checksum::Checksum(GChecksumType type) {
  if (const Crypto *crypto = loaded_crypto) {
    context_ = crypto->context_new();
    const void *method = type == G_CHECKSUM_MD5 ? crypto->md5() : crypto->sha256();
    // It refuses MD5 where a policy of the system forbids that, also as a mere checksum.
    if (context_ != nullptr && crypto->init(context_, method, nullptr) == 1) return;
    crypto->context_free(context_);
    context_ = nullptr;
  }
  checksum_.reset(g_checksum_new(type));
}

Checksum::~Checksum() {
  if (context_ != nullptr) loaded_crypto.load()->context_free(context_);
}

void Checksum::add(const char *data, std::size_t size) {
  if (context_ != nullptr) {
    loaded_crypto.load()->update(context_, data, size);
  } else {
    g_checksum_update(checksum_.get(), reinterpret_cast<const guchar *>(data),
                      static_cast<gssize>(size));
  }
}

std::string Checksum::hex() {
  if (context_ == nullptr) return g_checksum_get_string(checksum_.get());
  if (!hex_.empty()) return hex_;
  unsigned char bytes[kMostBytes];
  unsigned int size = 0;
  loaded_crypto.load()->final(context_, bytes, &size);
  for (unsigned int i = 0; i < size; ++i) {
    hex_ += kDigits[bytes[i] >> 4];
    hex_ += kDigits[bytes[i] & 0x0f];
  }
  return hex_;
}

}  // namespace transport
