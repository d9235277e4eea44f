#include "platform/trust_policy.h"

#include <openssl/bio.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>

#include <utility>

#include "platform/anchor_folder.h"

namespace vtr {
namespace {

struct X509Free {
  void operator()(X509* certificate) const { X509_free(certificate); }
};
using Certificate = std::unique_ptr<X509, X509Free>;
struct StackFree {
  void operator()(STACK_OF(X509) * stack) const { sk_X509_pop_free(stack, X509_free); }
};
struct StoreContextFree {
  void operator()(X509_STORE_CTX* context) const { X509_STORE_CTX_free(context); }
};
struct KeyContextFree {
  void operator()(EVP_PKEY_CTX* context) const { EVP_PKEY_CTX_free(context); }
};

// OpenSSL's latest error, as text, clearing the queue.
std::string OpenSslError() {
  const unsigned long code = ERR_get_error();
  ERR_clear_error();
  if (code == 0) return "unknown error";
  char text[256];
  ERR_error_string_n(code, text, sizeof text);
  return text;
}

Certificate FromDer(const Bytes& der) {
  const unsigned char* p = der.data();
  Certificate certificate(d2i_X509(nullptr, &p, static_cast<long>(der.size())));
  // Trailing bytes after the certificate: not one DER item.
  if (certificate && p != der.data() + der.size()) certificate.reset();
  return certificate;
}

// Adds every certificate of the PEM text to store; how many.
int AddPemCertificates(X509_STORE* store, const std::string& pem) {
  std::unique_ptr<BIO, decltype(&BIO_free)> bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())), BIO_free);
  if (!bio) return 0;
  int added = 0;
  while (X509* certificate = PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr)) {
    if (X509_STORE_add_cert(store, certificate) == 1) ++added;
    X509_free(certificate);
  }
  ERR_clear_error();  // the end of the text reads as an error
  return added;
}

}  // namespace

void PublicKeyFree::operator()(evp_pkey_st* key) const { EVP_PKEY_free(key); }

Result<TrustPolicy> TrustPolicy::Create(const std::string& folder, int rootFd, std::vector<std::string>* refusals) {
  Result<AnchorFolder> anchorFolder = ReadAnchorFolder(folder, rootFd);
  if (!anchorFolder.ok()) {
    if (refusals != nullptr && anchorFolder.error().code() == EPERM) refusals->push_back(anchorFolder.error().message());
    return anchorFolder.error();
  }
  if (refusals != nullptr) *refusals = std::move(anchorFolder->passedOver);
  X509_STORE* store = X509_STORE_new();
  if (store == nullptr) return Error(ENOMEM, "X509_STORE_new");
  TrustPolicy policy(store);
  int anchors = 0;
  for (const AnchorFile& file : anchorFolder->files) {
    const int added = AddPemCertificates(store, file.bytes);
    if (added == 0 && refusals != nullptr) refusals->push_back(file.path + " is passed over: no PEM certificate");
    anchors += added;
  }
  if (anchors == 0) return Error(ENOENT, folder + " holds no certificate");
  return policy;
}

TrustPolicy::TrustPolicy(TrustPolicy&& other) noexcept : store_(std::exchange(other.store_, nullptr)) {}

TrustPolicy& TrustPolicy::operator=(TrustPolicy&& other) noexcept {
  if (this != &other) {
    X509_STORE_free(store_);
    store_ = std::exchange(other.store_, nullptr);
  }
  return *this;
}

TrustPolicy::~TrustPolicy() { X509_STORE_free(store_); }

TrustEvaluation TrustPolicy::evaluate(const std::vector<Bytes>& chain) const {
  TrustEvaluation result;
  if (chain.empty()) {
    result.outcome = TrustOutcome::kCannotCreate;
    result.detail = "no certificate";
    return result;
  }
  std::vector<Certificate> certificates;
  for (const Bytes& der : chain) {
    certificates.push_back(FromDer(der));
    if (!certificates.back()) {
      result.outcome = TrustOutcome::kCannotLoadCertificate;
      result.detail = OpenSslError();
      return result;
    }
  }
  std::unique_ptr<STACK_OF(X509), StackFree> intermediates(sk_X509_new_null());
  std::unique_ptr<X509_STORE_CTX, StoreContextFree> context(X509_STORE_CTX_new());
  if (!intermediates || !context) {
    result.outcome = TrustOutcome::kCannotCreate;
    return result;
  }
  for (size_t i = 1; i < certificates.size(); ++i) {
    if (sk_X509_push(intermediates.get(), certificates[i].get()) <= 0) {
      result.outcome = TrustOutcome::kCannotCreate;
      return result;
    }
    certificates[i].release();  // the stack owns it now
  }
  X509* leaf = certificates[0].get();
  if (X509_STORE_CTX_init(context.get(), store_, leaf, intermediates.get()) != 1) {
    result.outcome = TrustOutcome::kCannotCreate;
    result.detail = OpenSslError();
    return result;
  }
  // Level 0 admits SHA-1 signatures and the key sizes of the format's era.
  X509_VERIFY_PARAM_set_auth_level(X509_STORE_CTX_get0_param(context.get()), 0);
  const int verified = X509_verify_cert(context.get());
  if (verified < 0) {
    result.outcome = TrustOutcome::kCannotEvaluate;
    result.detail = OpenSslError();
    return result;
  }
  if (verified == 0) {
    result.outcome = TrustOutcome::kNotTrusted;
    result.detail = X509_verify_cert_error_string(X509_STORE_CTX_get_error(context.get()));
    return result;
  }
  if ((X509_get_extension_flags(leaf) & EXFLAG_KUSAGE) != 0 && (X509_get_key_usage(leaf) & KU_DIGITAL_SIGNATURE) == 0) {
    result.outcome = TrustOutcome::kNotTrusted;
    result.detail = "the signing certificate may not sign";
    return result;
  }
  result.key.reset(X509_get_pubkey(leaf));
  result.outcome = result.key ? TrustOutcome::kTrusted : TrustOutcome::kNoPublicKey;
  return result;
}

bool VerifyRsaSha1Signature(evp_pkey_st* key, std::span<const uint8_t> signature, std::span<const uint8_t> data) {
  if (key == nullptr || EVP_PKEY_get_base_id(key) != EVP_PKEY_RSA) return false;
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  if (EVP_Digest(data.data(), data.size(), digest, &length, EVP_sha1(), nullptr) != 1) return false;
  std::unique_ptr<EVP_PKEY_CTX, KeyContextFree> context(EVP_PKEY_CTX_new(key, nullptr));
  const bool verified = context && EVP_PKEY_verify_init(context.get()) == 1 &&
                        EVP_PKEY_CTX_set_rsa_padding(context.get(), RSA_PKCS1_PADDING) == 1 &&
                        EVP_PKEY_CTX_set_signature_md(context.get(), EVP_sha1()) == 1 &&
                        EVP_PKEY_verify(context.get(), signature.data(), signature.size(), digest, length) == 1;
  ERR_clear_error();
  return verified;
}

}  // namespace vtr
