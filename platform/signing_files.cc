#include "platform/signing_files.h"

#include <openssl/bio.h>
#include <openssl/bn.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <ctime>

namespace vtr {
namespace {

// OpenSSL's reason for the last failure, or what.
Error OpenSslError(const std::string& what) {
  const unsigned long code = ERR_get_error();
  ERR_clear_error();
  if (code == 0) return Error::Invalid(what);
  char reason[256];
  ERR_error_string_n(code, reason, sizeof reason);
  return Error::Invalid(what + ": " + reason);
}

struct BioFree {
  void operator()(BIO* bio) const { BIO_free(bio); }
};
struct X509Free {
  void operator()(X509* certificate) const { X509_free(certificate); }
};
using BioPtr = std::unique_ptr<BIO, BioFree>;
using X509Ptr = std::unique_ptr<X509, X509Free>;

std::string NameLine(const X509_NAME* name) {
  BioPtr bio(BIO_new(BIO_s_mem()));
  X509_NAME_print_ex(bio.get(), name, 0, XN_FLAG_RFC2253);
  char* text = nullptr;
  const long length = BIO_get_mem_data(bio.get(), &text);
  return std::string(text, static_cast<size_t>(length));
}

std::string TimeText(const ASN1_TIME* time) {
  struct tm tm {};
  if (ASN1_TIME_to_tm(time, &tm) != 1) return "?";
  char text[32];
  std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%SZ", &tm);
  return text;
}

}  // namespace

Result<PublicKey> ReadPrivateKeyFile(const std::string& path) {
  BioPtr bio(BIO_new_file(path.c_str(), "r"));
  if (!bio) return OpenSslError(path + ": cannot be opened");
  PublicKey key(PEM_read_bio_PrivateKey(bio.get(), nullptr, nullptr, nullptr));
  if (!key) return OpenSslError(path + ": no PEM private key");
  return key;
}

Result<Bytes> ReadCertificateFile(const std::string& path) {
  BioPtr bio(BIO_new_file(path.c_str(), "rb"));
  if (!bio) return OpenSslError(path + ": cannot be opened");
  X509Ptr certificate(PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr));
  if (!certificate) {
    ERR_clear_error();
    BIO_reset(bio.get());
    certificate.reset(d2i_X509_bio(bio.get(), nullptr));
  }
  if (!certificate) return OpenSslError(path + ": no certificate (PEM or DER)");
  unsigned char* der = nullptr;
  const int length = i2d_X509(certificate.get(), &der);
  if (length <= 0) return OpenSslError(path + ": cannot be encoded");
  Bytes bytes(der, der + length);
  OPENSSL_free(der);
  return bytes;
}

Result<Bytes> SignRsaSha1(evp_pkey_st* key, std::span<const uint8_t> data) {
  std::unique_ptr<EVP_MD_CTX, decltype(&EVP_MD_CTX_free)> context(EVP_MD_CTX_new(), EVP_MD_CTX_free);
  EVP_PKEY_CTX* keyContext = nullptr;
  size_t length = 0;
  if (!context || EVP_DigestSignInit(context.get(), &keyContext, EVP_sha1(), nullptr, key) != 1 ||
      EVP_PKEY_CTX_set_rsa_padding(keyContext, RSA_PKCS1_PADDING) != 1 ||
      EVP_DigestSign(context.get(), nullptr, &length, data.data(), data.size()) != 1) {
    return OpenSslError("cannot sign with this key (an RSA key is needed)");
  }
  Bytes signature(length);
  if (EVP_DigestSign(context.get(), signature.data(), &length, data.data(), data.size()) != 1) {
    return OpenSslError("cannot sign");
  }
  signature.resize(length);
  return signature;
}

Result<bool> KeyMatchesCertificate(evp_pkey_st* key, std::span<const uint8_t> der) {
  const unsigned char* p = der.data();
  X509Ptr certificate(d2i_X509(nullptr, &p, static_cast<long>(der.size())));
  if (!certificate) return OpenSslError("not a DER certificate");
  const bool matches = X509_check_private_key(certificate.get(), key) == 1;
  ERR_clear_error();  // a mismatch leaves OpenSSL's reason queued
  return matches;
}

Result<CertificateSummary> DescribeCertificate(std::span<const uint8_t> der) {
  const unsigned char* p = der.data();
  X509Ptr certificate(d2i_X509(nullptr, &p, static_cast<long>(der.size())));
  if (!certificate) return OpenSslError("not a DER certificate");
  CertificateSummary summary;
  summary.subject = NameLine(X509_get_subject_name(certificate.get()));
  summary.issuer = NameLine(X509_get_issuer_name(certificate.get()));
  summary.notBefore = TimeText(X509_get0_notBefore(certificate.get()));
  summary.notAfter = TimeText(X509_get0_notAfter(certificate.get()));
  std::unique_ptr<BIGNUM, decltype(&BN_free)> serial(
      ASN1_INTEGER_to_BN(X509_get0_serialNumber(certificate.get()), nullptr), BN_free);
  if (serial) {
    char* hex = BN_bn2hex(serial.get());
    summary.serial = hex;
    OPENSSL_free(hex);
  }
  return summary;
}

}  // namespace vtr
