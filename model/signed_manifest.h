// VTRSignedManifest: the signed manifest of a demo content set, read and
// proven before any of its payload is used.
//
// The file is a property list (binary or XML): {"Version": 2, "Certificate":
// [DER, leaf first], "Payload": <the inner property list's bytes>,
// "Signature": <RSA PKCS#1 v1.5 SHA-1 signature of exactly those bytes>}.
// The chain must lead to a root of the production signing policy, or, only
// on a device that answers "SigningFuse" with false (unfused development
// hardware), of the test policy. The payload is a dictionary holding
// "Version" 3 or 4 and the keys "Info", "Backup", "App", "AppData", and
// optionally "GroupData" and "ExtensionData".
//
// Every failure is one log line (the messages are the system's own) and no
// object. An object is immutable; use it and its nodes from one thread at a
// time.
#ifndef VTR_MODEL_SIGNED_MANIFEST_H_
#define VTR_MODEL_SIGNED_MANIFEST_H_

#include <fcntl.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>

#include "platform/device_properties.h"
#include "platform/plist_document.h"
#include "platform/trust_policy.h"
#include "platform/value.h"

namespace vtr {

// Where the trust anchors of the two policies lie, and where the device
// tells whether it is fused (inside the sandbox root under --root): absolute
// paths resolved beneath rootFd (AT_FDCWD: as they stand).
struct SigningAnchors {
  std::string production = "/usr/share/vitd/anchors/production";
  std::string test = "/usr/share/vitd/anchors/test";
  std::string efiVariables = kEfiVariablesFolder;
  int rootFd = AT_FDCWD;
};

// Why a signed manifest was not read, for tools that answer by cause.
enum class SignedManifestFailure {
  kNone,
  kMalformed,           // not a property list, or a key missing or of the wrong type
  kUnsupportedVersion,  // outer or payload version not one this reads
  kNotTrusted,          // no policy trusts the certificate chain
  kBadSignature,        // the signature does not sign the payload
};

class VTRSignedManifest {
 public:
  // The verified manifest of the bytes of a signed manifest file, or nullopt
  // after the message saying why (unreadable, malformed, an unsupported
  // version, a chain no policy trusts, a bad signature), with the cause in
  // *failure when given. The object keeps the bytes: a binary payload is
  // read in place, one record at a time, never built whole.
  static std::optional<VTRSignedManifest> signedManifestWithBytes(std::string bytes,
                                                                  const SigningAnchors& anchors = {},
                                                                  SignedManifestFailure* failure = nullptr);
  // The same reading with the signature left unchecked: for tools that
  // show a manifest, never for trusting one. The same messages.
  static std::optional<VTRSignedManifest> unverifiedManifestWithBytes(std::string bytes,
                                                                      SignedManifestFailure* failure = nullptr);

  // The "Payload" bytes of the outer dictionary when its chain is trusted
  // and its signature good; nullopt otherwise.
  static std::optional<std::span<const uint8_t>> verifyManifestSignature(const PlistNode& outer,
                                                                         const SigningAnchors& anchors,
                                                                         SignedManifestFailure* failure = nullptr);

  // The signer's key when the chain is trusted under the production
  // (strong) or test (development) policy; null otherwise, after a message.
  static PublicKey createPublicKeyForStrongSigning(const Value& certificates, const SigningAnchors& anchors);
  static PublicKey createPublicKeyForDevelopmentSigning(const Value& certificates, const SigningAnchors& anchors);
  static PublicKey createPublicKeyForDevelopmentSigningStandard(const Value& certificates,
                                                                const SigningAnchors& anchors);
  static PublicKey createPublicKey(const Value& certificates, const TrustPolicy& policy);

  // Whether signature (data, else it has no bytes) signs data with key.
  static bool verifySignature(const Value& signature, std::span<const uint8_t> data, evp_pkey_st* key);

  // The payload and its parts (nil nodes where a key is missing). Nodes
  // are valid while this object lives.
  PlistNode payload() const { return contents_->payload->top(); }
  int32_t getVersion() const { return contents_->payloadVersion; }
  PlistNode getInfo() const { return payload().get("Info"); }
  PlistNode getManifest() const { return payload().get("Backup"); }
  PlistNode getAppList() const { return payload().get("App"); }
  PlistNode getAppDataList() const { return payload().get("AppData"); }
  PlistNode getGroupDataList() const { return payload().get("GroupData"); }
  PlistNode getPlugInDataList() const { return payload().get("ExtensionData"); }
  // The file manifest of container identifier of type "AppData" (under its
  // "Manifest"), "GroupData" or "ExtensionData"; nil when the type is none
  // of these or the payload holds no such manifest.
  PlistNode containerManifest(const std::string& type, const std::string& identifier) const;
  // Whether top has a signed manifest's outer form: payload data and a
  // certificate or signature beside it (nothing is checked).
  static bool LooksSigned(const PlistNode& top);

  // The outer layer, for tools that show it: its version as read, the
  // certificates (DER data, leaf first), the payload's size and format.
  const Value& outerVersion() const { return contents_->outerVersion; }
  const Value& certificates() const { return contents_->certificates; }
  size_t payloadSize() const { return contents_->payloadBytes.size(); }
  PlistFormat payloadFormat() const { return contents_->payload->format(); }

 private:
  // Everything a manifest reads from, kept at one address so that nodes
  // into it stay valid when the object moves.
  struct Contents {
    std::string file;
    std::unique_ptr<PlistDocument> outer;
    PlistNode payloadNode;  // keeps the payload bytes of an XML file alive
    std::span<const uint8_t> payloadBytes;
    std::unique_ptr<PlistDocument> payload;
    Value outerVersion;
    Value certificates;
    int32_t payloadVersion = 0;
  };

  static std::optional<VTRSignedManifest> Read(std::string bytes, const SigningAnchors* anchors,
                                               SignedManifestFailure* failure);
  explicit VTRSignedManifest(std::unique_ptr<Contents> contents) : contents_(std::move(contents)) {}

  std::unique_ptr<Contents> contents_;
};

}  // namespace vtr

#endif  // VTR_MODEL_SIGNED_MANIFEST_H_
