#include "certificates.h"

#include <openssl/ec.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <cctype>
#include <cstdlib>

namespace {

std::string text_of(BIO *bio) {
  char *data = nullptr;
  const long size = BIO_get_mem_data(bio, &data);
  std::string text(data, static_cast<std::size_t>(size));
  BIO_free(bio);
  return text;
}

void add_extension(X509 *certificate, int kind, const std::string &value) {
  X509V3_CTX context;
  X509V3_set_ctx(&context, certificate, certificate, nullptr, nullptr, 0);
  X509_EXTENSION *extension = X509V3_EXT_conf_nid(nullptr, &context, kind, value.c_str());
  if (extension == nullptr) abort();
  X509_add_ext(certificate, extension, -1);
  X509_EXTENSION_free(extension);
}

}  // namespace

front::Identity make_identity(const std::string &name, const Validity &validity) {
  EVP_PKEY *key = EVP_EC_gen("P-256");
  X509 *certificate = X509_new();
  X509_set_version(certificate, X509_VERSION_3);
  ASN1_INTEGER_set(X509_get_serialNumber(certificate), 1);
  X509_gmtime_adj(X509_getm_notBefore(certificate), validity.from_seconds);
  X509_gmtime_adj(X509_getm_notAfter(certificate), validity.to_seconds);
  X509_NAME *subject = X509_get_subject_name(certificate);
  X509_NAME_add_entry_by_txt(subject, "CN", MBSTRING_ASC,
                             reinterpret_cast<const unsigned char *>(name.c_str()), -1, -1, 0);
  X509_set_issuer_name(certificate, subject);
  X509_set_pubkey(certificate, key);
  const bool is_address = std::isdigit(static_cast<unsigned char>(name[0])) != 0;
  add_extension(certificate, NID_subject_alt_name, (is_address ? "IP:" : "DNS:") + name);
  add_extension(certificate, NID_basic_constraints, "critical,CA:TRUE");
  if (X509_sign(certificate, key, EVP_sha256()) == 0) abort();
  BIO *certificate_text = BIO_new(BIO_s_mem());
  PEM_write_bio_X509(certificate_text, certificate);
  BIO *key_text = BIO_new(BIO_s_mem());
  PEM_write_bio_PrivateKey(key_text, key, nullptr, nullptr, 0, nullptr, nullptr);
  X509_free(certificate);
  EVP_PKEY_free(key);
  return {text_of(certificate_text), text_of(key_text)};
}
