// Trust policies: whether a certificate chain leads to one of a policy's
// trusted roots, and the signer's public key when it does, with OpenSSL.
//
// A policy is the set of PEM certificates in one anchors folder (every
// *.pem file there that root put there and closed to others is a trusted
// root, see anchor_folder.h; no hashed names needed), read anew
// each time a policy is made, so an operator's change takes effect on the
// next verification. Intermediates come only from the chain being
// evaluated. Chains signed with SHA-1 verify: the security level that
// allows them is set explicitly, whatever the distribution's default.
// Validity periods are checked against the current time, and a leaf with a
// key-usage extension must allow digital signatures.
//
// Objects are move-only owners of OpenSSL state; use one per thread.
#ifndef VTR_PLATFORM_TRUST_POLICY_H_
#define VTR_PLATFORM_TRUST_POLICY_H_

#include <fcntl.h>

#include <memory>
#include <span>
#include <string>
#include <vector>

#include "platform/result.h"
#include "platform/value.h"

struct evp_pkey_st;
struct x509_store_st;

namespace vtr {

// An owned public key.
struct PublicKeyFree {
  void operator()(evp_pkey_st* key) const;
};
using PublicKey = std::unique_ptr<evp_pkey_st, PublicKeyFree>;

// How an evaluation ended, in the terms of the platform's trust results.
enum class TrustOutcome {
  kTrusted,                // chain to a trusted root, leaf fit to sign
  kCannotLoadCertificate,  // an entry is not a DER certificate
  kCannotCreate,           // the trust object could not be set up
  kCannotEvaluate,         // the evaluation itself failed
  kNotTrusted,             // evaluated: no valid chain, expired, unfit leaf
  kNoPublicKey,            // trusted, but the leaf's key cannot be had
};

struct TrustEvaluation {
  TrustOutcome outcome = TrustOutcome::kCannotEvaluate;
  PublicKey key;       // kTrusted only
  std::string detail;  // OpenSSL's reason, for diagnostics
};

class TrustPolicy {
 public:
  // The policy of the PEM certificates in folder, an absolute path resolved
  // beneath rootFd (AT_FDCWD: from "/"), read as ReadAnchorFolder reads it.
  // An Error when the folder is missing, refused (not closed to others) or
  // holds no usable certificate: the policy cannot be created. refusals, when
  // given, receives one line for each anchor passed over and for a refused
  // folder, naming it and why, for the caller to log.
  static Result<TrustPolicy> Create(const std::string& folder, int rootFd = AT_FDCWD,
                                    std::vector<std::string>* refusals = nullptr);

  TrustPolicy(TrustPolicy&&) noexcept;
  TrustPolicy& operator=(TrustPolicy&&) noexcept;
  ~TrustPolicy();

  // Evaluates chain (DER certificates, leaf first, then intermediates).
  TrustEvaluation evaluate(const std::vector<Bytes>& chain) const;

 private:
  explicit TrustPolicy(x509_store_st* store) : store_(store) {}
  x509_store_st* store_;
};

// Whether signature is an RSA PKCS#1 v1.5 signature of the SHA-1 digest of
// data (DigestInfo included) by key.
bool VerifyRsaSha1Signature(evp_pkey_st* key, std::span<const uint8_t> signature, std::span<const uint8_t> data);

}  // namespace vtr

#endif  // VTR_PLATFORM_TRUST_POLICY_H_
