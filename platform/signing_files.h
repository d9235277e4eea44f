// The files a signer works with: a private key, certificates in PEM or DER,
// and what a person wants to know of a certificate. For the tools that make
// and inspect signed manifests; the helper itself only verifies (see
// trust_policy.h).
#ifndef VTR_PLATFORM_SIGNING_FILES_H_
#define VTR_PLATFORM_SIGNING_FILES_H_

#include <memory>
#include <span>
#include <string>

#include "platform/result.h"
#include "platform/trust_policy.h"
#include "platform/value.h"

namespace vtr {

// The private key in the PEM file at path (unencrypted).
Result<PublicKey> ReadPrivateKeyFile(const std::string& path);

// The certificate in the file at path, PEM or DER, as DER.
Result<Bytes> ReadCertificateFile(const std::string& path);

// An RSA PKCS#1 v1.5 signature of the SHA-1 digest of data by key: what
// VerifyRsaSha1Signature accepts.
Result<Bytes> SignRsaSha1(evp_pkey_st* key, std::span<const uint8_t> data);

// Whether key is the private key of the DER certificate: true when the
// certificate's public key belongs to it; an Error for bytes that are no
// certificate.
Result<bool> KeyMatchesCertificate(evp_pkey_st* key, std::span<const uint8_t> der);

struct CertificateSummary {
  std::string subject;    // one line, RFC 2253 order ("CN=...,O=...")
  std::string issuer;
  std::string notBefore;  // "YYYY-MM-DDTHH:MM:SSZ"
  std::string notAfter;
  std::string serial;     // hex
};

// What the DER certificate says of itself; an Error for bytes that are no
// certificate.
Result<CertificateSummary> DescribeCertificate(std::span<const uint8_t> der);

}  // namespace vtr

#endif  // VTR_PLATFORM_SIGNING_FILES_H_
