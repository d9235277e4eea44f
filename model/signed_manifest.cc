#include "model/signed_manifest.h"

#include <algorithm>

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
// An XML payload is built whole, at about 3.5 times its size; beyond this it
// would take a restore past its memory bound (a binary one is read in place).
constexpr size_t kMaxXmlPayloadBytes = size_t{12} << 20;
constexpr std::string_view kBinaryPlistMagic = "bplist";
constexpr long kStatusInternal = -2070;
constexpr long kResultRecoverableFailure = 5;

// A property-list document of bytes, or null after the conversion message.
std::unique_ptr<PlistDocument> OpenDocument(std::span<const uint8_t> bytes, const char* function) {
  PlistLimits limits;
  limits.maxInputBytes = std::max<uint64_t>(limits.maxInputBytes, bytes.size());
  Result<std::unique_ptr<PlistDocument>> document = PlistDocument::Open(bytes, limits);
  if (!document.ok()) {
    VTRLogError("%s: Cannot convert to property list - %@(0x%x).", function, document.error().description(),
                static_cast<unsigned>(document.error().code()));
    return nullptr;
  }
  return std::move(*document);
}

// The value of a node that is small by nature (a version, the certificates,
// the signature); nil for a node too large to build.
Value Small(const PlistNode& node) {
  Result<Value> value = node.value();
  return value.ok() ? std::move(*value) : Value();
}

// The trust policy of folder; each anchor passed over, and a folder refused,
// is one line of its own under function's name.
Result<TrustPolicy> CreatePolicy(const std::string& folder, int rootFd, const char* function) {
  std::vector<std::string> refusals;
  Result<TrustPolicy> policy = TrustPolicy::Create(folder, rootFd, &refusals);
  for (const std::string& refusal : refusals) VTRLogError("%s: %s.", function, refusal);
  return policy;
}

}  // namespace

std::optional<VTRSignedManifest> VTRSignedManifest::signedManifestWithBytes(std::string bytes,
                                                                            const SigningAnchors& anchors,
                                                                            SignedManifestFailure* failure) {
  return Read(std::move(bytes), &anchors, failure);
}

std::optional<VTRSignedManifest> VTRSignedManifest::unverifiedManifestWithBytes(std::string bytes,
                                                                                SignedManifestFailure* failure) {
  return Read(std::move(bytes), nullptr, failure);
}

std::optional<VTRSignedManifest> VTRSignedManifest::Read(std::string bytes, const SigningAnchors* anchors,
                                                         SignedManifestFailure* failure) {
  SignedManifestFailure ignored;
  if (failure == nullptr) failure = &ignored;
  *failure = SignedManifestFailure::kMalformed;
  auto contents = std::make_unique<Contents>();
  contents->file = std::move(bytes);
  const std::span<const uint8_t> file(reinterpret_cast<const uint8_t*>(contents->file.data()), contents->file.size());
  contents->outer = OpenDocument(file, kInit);
  if (!contents->outer) return std::nullopt;
  const PlistNode outer = contents->outer->top();
  if (!outer.isDictionary()) {
    VTRLogError("%s: format not correct.", kInit);
    return std::nullopt;
  }
  contents->outerVersion = Small(outer.get("Version"));
  if (contents->outerVersion.isNil()) {
    VTRLogError("%s: required key (version) not found.", kInit);
    return std::nullopt;
  }
  if (contents->outerVersion.intValue() != 2) {
    VTRLogError("%s: signed manifest version %d is not supported yet", kInit, contents->outerVersion.intValue());
    *failure = SignedManifestFailure::kUnsupportedVersion;
    return std::nullopt;
  }
  if (anchors != nullptr) {
    if (!verifyManifestSignature(outer, *anchors, failure)) return std::nullopt;
    *failure = SignedManifestFailure::kMalformed;
    VTRLog("Manifest passed signature check.");
  }
  contents->certificates = Small(outer.get("Certificate"));
  contents->payloadNode = outer.get("Payload");
  const std::optional<std::span<const uint8_t>> payloadBytes = contents->payloadNode.data();
  if (!payloadBytes) {
    // The method name is the only argument; the object prints as (null).
    VTRLogError("%s: required key (payload) not found: %@", kInit, nullptr);
    return std::nullopt;
  }
  contents->payloadBytes = *payloadBytes;
  if (contents->outer->format() == PlistFormat::kXml) {
    // The text is no longer needed: its values hold the decoded payload.
    contents->file = std::string();
  }
  const std::string_view payloadStart(reinterpret_cast<const char*>(contents->payloadBytes.data()),
                                      std::min(contents->payloadBytes.size(), kBinaryPlistMagic.size()));
  if (payloadStart != kBinaryPlistMagic && contents->payloadBytes.size() > kMaxXmlPayloadBytes) {
    VTRLogError("%s: XML payload too large to read.", kInit);
    return std::nullopt;
  }
  contents->payload = OpenDocument(contents->payloadBytes, kInit);
  if (!contents->payload) return std::nullopt;
  const PlistNode payload = contents->payload->top();
  if (!payload.isDictionary()) {
    VTRLogError("%s: payload format not correct.", kInit);
    return std::nullopt;
  }
  const Value payloadVersion = Small(payload.get("Version"));
  if (payloadVersion.isNil()) {
    VTRLogError("%s: required key (version) not found.", kInit);
    return std::nullopt;
  }
  if (payloadVersion.intValue() != 3 && payloadVersion.intValue() != 4) {
    VTRLogError("%s: raw manifest version %@ is not supported.", kInit, payloadVersion);
    *failure = SignedManifestFailure::kUnsupportedVersion;
    return std::nullopt;
  }
  contents->payloadVersion = payloadVersion.intValue();
  for (const char* key : {"Info", "Backup", "App", "AppData"}) {
    if (payload.get(key).isNil()) {
      VTRLogError("%s: required key (Info, App, AppData, or Manifest) not found: %@", kInit, nullptr);
      return std::nullopt;
    }
  }
  *failure = SignedManifestFailure::kNone;
  return VTRSignedManifest(std::move(contents));
}

std::optional<std::span<const uint8_t>> VTRSignedManifest::verifyManifestSignature(const PlistNode& outer,
                                                                                   const SigningAnchors& anchors,
                                                                                   SignedManifestFailure* failure) {
  SignedManifestFailure ignored;
  if (failure == nullptr) failure = &ignored;
  *failure = SignedManifestFailure::kMalformed;
  const Value certificates = Small(outer.get("Certificate"));
  if (certificates.array() == nullptr) {
    VTRLogError("%s: cannot find certificates, or certificate format not correct.", kVerify);
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
    VTRLogError("%s: Certificate not valid.", kVerify);
    *failure = SignedManifestFailure::kNotTrusted;
    return std::nullopt;
  }
  const std::optional<std::span<const uint8_t>> payload = outer.get("Payload").data();
  if (!payload) {
    VTRLogError("%s: Manifest format not correct.", kVerify);
    return std::nullopt;
  }
  if (!verifySignature(Small(outer.get("Signature")), *payload, key.get())) {
    *failure = SignedManifestFailure::kBadSignature;
    return std::nullopt;
  }
  *failure = SignedManifestFailure::kNone;
  return payload;
}

PublicKey VTRSignedManifest::createPublicKeyForStrongSigning(const Value& certificates, const SigningAnchors& anchors) {
  Result<TrustPolicy> policy = CreatePolicy(anchors.production, anchors.rootFd, kStrong);
  if (!policy.ok()) {
    VTRLogError("%s: Cannot create policy.", kStrong);
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
  Result<TrustPolicy> policy = CreatePolicy(anchors.test, anchors.rootFd, kDevelopmentStandard);
  if (!policy.ok()) {
    VTRLogError("%s: Cannot create policy.", kDevelopmentStandard);
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
      VTRLogError("%s: Cannot load certificate.", kCertificateBlock);
      return nullptr;
    case TrustOutcome::kCannotCreate:
      VTRLogError("%s: Cannot create secure trust object: %ld", kCreatePublicKey, kStatusParameter);
      return nullptr;
    case TrustOutcome::kCannotEvaluate:
      VTRLogError("%s: Cannot evaluate trust: %ld", kCreatePublicKey, kStatusInternal);
      return nullptr;
    case TrustOutcome::kNotTrusted:
      VTRLogError("%s: certificate trust evaluation failed: %ld", kCreatePublicKey, kResultRecoverableFailure);
      return nullptr;
    case TrustOutcome::kNoPublicKey:
      VTRLogError("%s: Cannot extract public key.", kCreatePublicKey);
      return nullptr;
  }
  return nullptr;
}

bool VTRSignedManifest::verifySignature(const Value& signature, std::span<const uint8_t> data, evp_pkey_st* key) {
  VTRDebugLog("verifySignature is called");
  const Bytes* bytes = signature.data();
  const bool verified = bytes != nullptr && VerifyRsaSha1Signature(key, *bytes, data);
  if (!verified)
    VTRDebugLog("%s: Failed in verifying signature(%ld)", "-[VTRSignedManifest verifySignature:forData:withKey:]",
                -67808L);
  return verified;
}

PlistNode VTRSignedManifest::containerManifest(const std::string& type, const std::string& identifier) const {
  if (type == "AppData") return getAppDataList().get(identifier).get("Manifest");
  if (type == "GroupData") return getGroupDataList().get(identifier);
  if (type == "ExtensionData") return getPlugInDataList().get(identifier);
  return PlistNode();
}

bool VTRSignedManifest::LooksSigned(const PlistNode& top) {
  return top.isDictionary() && top.get("Payload").data().has_value() &&
         (!top.get("Certificate").isNil() || !top.get("Signature").isNil());
}

}  // namespace vtr
