#include "model/signed_manifest.h"

#include "model/log.h"
#include "platform/plist.h"

namespace vtr {
namespace {

constexpr char kInit[] = "-[VTRSignedManifest initWithNSStream:]";
constexpr char kVerify[] = "-[VTRSignedManifest verifyManifestSignature:]";
constexpr char kStrong[] = "-[VTRSignedManifest createPublicKeyForStrongSigning:]";
constexpr char kDevelopmentStandard[] = "-[VTRSignedManifest createPublicKeyForDevelopmentSigningStandard:]";
constexpr char kCreatePublicKey[] = "-[VTRSignedManifest createPublicKey:usingPolicy:]";
constexpr char kCertificateBlock[] = "__49-[VTRSignedManifest createPublicKey:usingPolicy:]_block_invoke";

// The platform's status numbers for the trust steps that fail: a parameter
// refused (no certificate to trust), an internal failure, and the trust
// result of a chain that does not verify (a recoverable trust failure).
constexpr long kStatusParameter = -50;
constexpr long kStatusInternal = -2070;
constexpr long kResultRecoverableFailure = 5;

// A property list read from bytes, or nullopt after the conversion message.
std::optional<Value> PropertyList(std::span<const uint8_t> bytes, const char* function) {
  PlistLimits limits;
  limits.maxInputBytes = std::max<uint64_t>(limits.maxInputBytes, bytes.size());
  Result<Value> value = ReadPropertyList(bytes, limits);
  if (!value.ok()) {
    VTRLog("%s: Cannot convert to property list - %@(0x%x).", function, value.error().description(),
           static_cast<unsigned>(value.error().code()));
    return std::nullopt;
  }
  return std::move(*value);
}

}  // namespace

std::optional<VTRSignedManifest> VTRSignedManifest::signedManifestWithBytes(std::span<const uint8_t> bytes,
                                                                            const SigningAnchors& anchors) {
  std::optional<Value> outer = PropertyList(bytes, kInit);
  if (!outer) return std::nullopt;
  if (outer->dictionary() == nullptr) {
    VTRLog("%s: format not correct.", kInit);
    return std::nullopt;
  }
  const Value version = outer->get("Version");
  if (version.isNil()) {
    VTRLog("%s: required key (version) not found.", kInit);
    return std::nullopt;
  }
  if (version.intValue() != 2) {
    VTRLog("%s: signed manifest version %d is not supported yet", kInit, version.intValue());
    return std::nullopt;
  }
  if (!verifyManifestSignature(*outer, anchors)) return std::nullopt;
  VTRLog("Manifest passed signature check.");
  const Bytes* payloadBytes = outer->get("Payload").data();
  if (payloadBytes == nullptr) {
    // The method name is the only argument; the object prints as (null).
    VTRLog("%s: required key (payload) not found: %@", kInit, nullptr);
    return std::nullopt;
  }
  std::optional<Value> payload = PropertyList(*payloadBytes, kInit);
  if (!payload) return std::nullopt;
  if (payload->dictionary() == nullptr) {
    VTRLog("%s: payload format not correct.", kInit);
    return std::nullopt;
  }
  const Value payloadVersion = payload->get("Version");
  if (payloadVersion.isNil()) {
    VTRLog("%s: required key (version) not found.", kInit);
    return std::nullopt;
  }
  if (payloadVersion.intValue() != 3 && payloadVersion.intValue() != 4) {
    VTRLog("%s: raw manifest version %@ is not supported.", kInit, payloadVersion);
    return std::nullopt;
  }
  for (const char* key : {"Info", "Backup", "App", "AppData"}) {
    if (payload->get(key).isNil()) {
      VTRLog("%s: required key (Info, App, AppData, or Manifest) not found: %@", kInit, nullptr);
      return std::nullopt;
    }
  }
  return VTRSignedManifest(std::move(*payload));
}

std::optional<Bytes> VTRSignedManifest::verifyManifestSignature(const Value& outer, const SigningAnchors& anchors) {
  const Value certificates = outer.get("Certificate");
  if (certificates.array() == nullptr) {
    VTRLog("%s: cannot find certificates, or certificate format not correct.", kVerify);
    return std::nullopt;
  }
  PublicKey key = createPublicKeyForStrongSigning(certificates, anchors);
  if (!key) {
    VTRDebugLog("Failed in strong signing verification.");
    // Development signing only on hardware that says it is not fused.
    if (SigningFuse(anchors.efiVariables, anchors.rootFd) == false) {
      VTRDebugLog("Trying development signing on development hardware...");
      key = createPublicKeyForDevelopmentSigning(certificates, anchors);
    }
  }
  if (!key) {
    VTRLog("%s: Certificate not valid.", kVerify);
    return std::nullopt;
  }
  const Bytes* payload = outer.get("Payload").data();
  if (payload == nullptr) {
    VTRLog("%s: Manifest format not correct.", kVerify);
    return std::nullopt;
  }
  if (!verifySignature(outer.get("Signature"), *payload, key.get())) return std::nullopt;
  return *payload;
}

PublicKey VTRSignedManifest::createPublicKeyForStrongSigning(const Value& certificates,
                                                             const SigningAnchors& anchors) {
  Result<TrustPolicy> policy = TrustPolicy::Create(anchors.production, anchors.rootFd);
  if (!policy.ok()) {
    VTRLog("%s: Cannot create policy.", kStrong);
    return nullptr;
  }
  VTRLog("Verifing strong signing");
  return createPublicKey(certificates, *policy);
}

PublicKey VTRSignedManifest::createPublicKeyForDevelopmentSigning(const Value& certificates,
                                                                  const SigningAnchors& anchors) {
  VTRLog("Verifing development signing");
  return createPublicKeyForDevelopmentSigningStandard(certificates, anchors);
}

PublicKey VTRSignedManifest::createPublicKeyForDevelopmentSigningStandard(const Value& certificates,
                                                                          const SigningAnchors& anchors) {
  Result<TrustPolicy> policy = TrustPolicy::Create(anchors.test, anchors.rootFd);
  if (!policy.ok()) {
    VTRLog("%s: Cannot create policy.", kDevelopmentStandard);
    return nullptr;
  }
  return createPublicKey(certificates, *policy);
}

PublicKey VTRSignedManifest::createPublicKey(const Value& certificates, const TrustPolicy& policy) {
  std::vector<Bytes> chain;
  if (const Array* items = certificates.array()) {
    for (const Value& item : *items) {
      const Bytes* der = item.data();
      // Something that is no data is no certificate either.
      chain.push_back(der != nullptr ? *der : Bytes());
    }
  }
  TrustEvaluation evaluation = policy.evaluate(chain);
  switch (evaluation.outcome) {
    case TrustOutcome::kTrusted:
      return std::move(evaluation.key);
    case TrustOutcome::kCannotLoadCertificate:
      VTRLog("%s: Cannot load certificate.", kCertificateBlock);
      return nullptr;
    case TrustOutcome::kCannotCreate:
      VTRLog("%s: Cannot create secure trust object: %ld", kCreatePublicKey, kStatusParameter);
      return nullptr;
    case TrustOutcome::kCannotEvaluate:
      VTRLog("%s: Cannot evaluate trust: %ld", kCreatePublicKey, kStatusInternal);
      return nullptr;
    case TrustOutcome::kNotTrusted:
      VTRLog("%s: certificate trust evaluation failed: %ld", kCreatePublicKey, kResultRecoverableFailure);
      return nullptr;
    case TrustOutcome::kNoPublicKey:
      VTRLog("%s: Cannot extract public key.", kCreatePublicKey);
      return nullptr;
  }
  return nullptr;
}

bool VTRSignedManifest::verifySignature(const Value& signature, const Bytes& data, evp_pkey_st* key) {
  VTRDebugLog("verifySignature is called");
  const Bytes* bytes = signature.data();
  const bool verified = bytes != nullptr && VerifyRsaSha1Signature(key, *bytes, data);
  if (!verified) VTRDebugLog("%s: Failed in verifying signature(%ld)", "-[VTRSignedManifest verifySignature:forData:withKey:]", -67808L);
  return verified;
}

}  // namespace vtr
