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
// Every failure is one log line (the messages below are the system's own)
// and no object. An object is immutable; use it from one thread at a time.
#ifndef VTR_MODEL_SIGNED_MANIFEST_H_
#define VTR_MODEL_SIGNED_MANIFEST_H_

#include <fcntl.h>

#include <cstdint>
#include <optional>
#include <span>
#include <string>

#include "platform/device_properties.h"
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

class VTRSignedManifest {
 public:
  // The verified manifest of the bytes of a signed manifest file, or nullopt
  // after the message saying why (unreadable, malformed, an unsupported
  // version, a chain no policy trusts, a bad signature).
  static std::optional<VTRSignedManifest> signedManifestWithBytes(std::span<const uint8_t> bytes,
                                                                  const SigningAnchors& anchors = {});

  // The "Payload" bytes of the outer dictionary when its chain is trusted
  // and its signature good; nullopt otherwise.
  static std::optional<Bytes> verifyManifestSignature(const Value& outer, const SigningAnchors& anchors);

  // The signer's key when the chain is trusted under the production
  // (strong) or test (development) policy; null otherwise, after a message.
  static PublicKey createPublicKeyForStrongSigning(const Value& certificates, const SigningAnchors& anchors);
  static PublicKey createPublicKeyForDevelopmentSigning(const Value& certificates, const SigningAnchors& anchors);
  static PublicKey createPublicKeyForDevelopmentSigningStandard(const Value& certificates,
                                                                const SigningAnchors& anchors);
  static PublicKey createPublicKey(const Value& certificates, const TrustPolicy& policy);

  // Whether signature (data, else it has no bytes) signs data with key.
  static bool verifySignature(const Value& signature, const Bytes& data, evp_pkey_st* key);

  // The parsed payload and its parts (nil where a key is missing).
  const Value& payload() const { return payload_; }
  int32_t getVersion() const { return payload_.get("Version").intValue(); }
  Value getInfo() const { return payload_.get("Info"); }
  Value getManifest() const { return payload_.get("Backup"); }
  Value getAppList() const { return payload_.get("App"); }
  Value getAppDataList() const { return payload_.get("AppData"); }
  Value getGroupDataList() const { return payload_.get("GroupData"); }
  Value getPlugInDataList() const { return payload_.get("ExtensionData"); }

 private:
  explicit VTRSignedManifest(Value payload) : payload_(std::move(payload)) {}

  Value payload_;
};

}  // namespace vtr

#endif  // VTR_MODEL_SIGNED_MANIFEST_H_
