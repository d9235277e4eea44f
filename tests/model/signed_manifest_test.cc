// Signed manifests against the throwaway PKI of tests/support/test_pki.h,
// and a signer that expired, made here.
#include "model/signed_manifest.h"

#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <sys/stat.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <memory>

#include <gtest/gtest.h>

#include "platform/plist.h"
#include "tests/support/test_pki.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::IsRoot;
using testing::LogCapture;
using testing::TestPki;
using testing::TempDir;
using testing::WriteFile;

constexpr char kStrongFunction[] = "-[VTRSignedManifest createPublicKeyForStrongSigning:]";

class SignedManifestTest : public ::testing::Test {
 protected:
  void SetUp() override {
    anchors_.production = pki_.file("production");
    anchors_.test = pki_.file("test");
    anchors_.efiVariables = efi_.path();
  }

  std::optional<VTRSignedManifest> Read(const Bytes& file) const {
    return VTRSignedManifest::signedManifestWithBytes(std::string(file.begin(), file.end()), anchors_);
  }

  static std::string Pki(const std::string& name) { return TestPki::Get().file(name); }

  static Value Payload(Value version = Value::Integer(3)) {
    const Value record = Value::DictionaryOf({{"VTRManifestFileHash", Value::Data({1, 2, 3})}});
    return Value::DictionaryOf({
        {"Version", version},
        {"Info", Value::String("demo")},
        {"Backup", Value::DictionaryOf({{"/", record}})},
        {"App", Value::ArrayOf({})},
        {"AppData", Value::DictionaryOf({{"com.example.app", Value::DictionaryOf({{"Manifest", Value::DictionaryOf({})}})}})},
    });
  }

  // A signed manifest: chain names .der files of the PKI, key a .key file.
  static Bytes Signed(const Value& payload, const std::vector<std::string>& chain, const std::string& key,
                      Value version = Value::Integer(2), bool flipPayload = false) {
    std::vector<std::string> names;
    for (const std::string& path : chain) names.push_back(path.substr(path.rfind('/') + 1));
    return TestPki::Get().signedManifest(payload, names, key.substr(key.rfind('/') + 1), version, flipPayload);
  }
  static Bytes ProductionSigned(const Value& payload) { return TestPki::Get().productionSigned(payload); }

  // The device's Secure Boot answer: 1 fused, 0 not, -1 none.
  void SetFuse(int value) {
    const std::string path = efi_ / "SecureBoot-8be4df61-93ca-11d2-aa0d-00e098032b8c";
    ::unlink(path.c_str());
    if (value >= 0) WriteFile(path, std::string("\x06\x00\x00\x00", 4) + static_cast<char>(value));
  }

  const TestPki& pki_ = TestPki::Get();
  TempDir efi_;
  SigningAnchors anchors_;
};

TEST_F(SignedManifestTest, AProductionSignedManifestIsReadWithItsPartsInEitherFormat) {
  for (const PlistFormat outer : {PlistFormat::kBinary, PlistFormat::kXml}) {
    for (const PlistFormat inner : {PlistFormat::kBinary, PlistFormat::kXml}) {
      SCOPED_TRACE(::testing::Message() << "outer " << static_cast<int>(outer) << " inner " << static_cast<int>(inner));
      LogCapture log;
      std::optional<VTRSignedManifest> manifest = Read(pki_.productionSigned(Payload(), outer, inner));
      ASSERT_TRUE(manifest.has_value()) << ::testing::PrintToString(log.messages());
      // Moved, its nodes still read (they point into what it keeps).
      const VTRSignedManifest moved = std::move(*manifest);
      EXPECT_EQ(moved.getVersion(), 3);
      EXPECT_EQ(*moved.getInfo().value(), Value::String("demo"));
      EXPECT_EQ(*moved.getManifest().get("/").value(), *Payload().get("Backup").dictionary()->find("/"));
      EXPECT_TRUE(moved.getAppDataList().get("com.example.app").get("Manifest").isDictionary());
      EXPECT_TRUE(moved.getGroupDataList().isNil());
      EXPECT_TRUE(moved.getPlugInDataList().isNil());
      EXPECT_EQ(moved.payloadFormat(), inner);
      EXPECT_EQ(moved.certificates().array()->size(), 2u);
      EXPECT_EQ(log.messages(),
                (std::vector<std::string>{"Verifing strong signing", "Manifest passed signature check."}));
    }
  }
}

TEST_F(SignedManifestTest, VersionsAndRequiredKeysAreCheckedWithTheirMessages) {
  const std::string init = "-[VTRSignedManifest initWithNSStream:]: ";
  const auto without = [](const char* key) {
    Value payload = Payload();
    DictionaryBuilder builder;
    for (const auto& [k, v] : *payload.dictionary()) {
      if (k != key) builder.add(k, v);
    }
    return builder.build();
  };
  const struct {
    const char* name;
    Bytes file;
    const char* lastMessage;  // nullptr: accepted
  } cases[] = {
      {"outer version 1", Signed(Payload(), {Pki("signer.der")}, Pki("signer.key"), Value::Integer(1)),
       "signed manifest version 1 is not supported yet"},
      {"outer version 3", Signed(Payload(), {Pki("signer.der")}, Pki("signer.key"), Value::Integer(3)),
       "signed manifest version 3 is not supported yet"},
      {"outer version \"2.5\"",
       Signed(Payload(), {Pki("signer.der"), Pki("intermediate.der")}, Pki("signer.key"), Value::String("2.5")),
       nullptr},
      {"payload version 2", ProductionSigned(Payload(Value::Integer(2))), "raw manifest version 2 is not supported."},
      {"payload version 5", ProductionSigned(Payload(Value::Integer(5))), "raw manifest version 5 is not supported."},
      {"payload version 4", ProductionSigned(Payload(Value::Integer(4))), nullptr},
      {"no Backup", ProductionSigned(without("Backup")),
       "required key (Info, App, AppData, or Manifest) not found: (null)"},
      {"no AppData", ProductionSigned(without("AppData")),
       "required key (Info, App, AppData, or Manifest) not found: (null)"},
      {"no payload version", ProductionSigned(without("Version")), "required key (version) not found."},
      {"not a property list", Bytes{'n', 'o', 'p', 'e'}, nullptr},
  };
  for (const auto& c : cases) {
    LogCapture log;
    const bool read = Read(c.file).has_value();
    EXPECT_EQ(read, c.lastMessage == nullptr && std::string(c.name) != "not a property list") << c.name;
    if (c.lastMessage != nullptr) {
      ASSERT_FALSE(log.messages().empty()) << c.name;
      EXPECT_EQ(log.messages().back(), init + c.lastMessage) << c.name;
    }
  }
  LogCapture log;
  EXPECT_FALSE(Read(Bytes{'n', 'o', 'p', 'e'}));
  ASSERT_EQ(log.messages().size(), 1u);
  EXPECT_EQ(log.messages()[0].rfind(init + "Cannot convert to property list - ", 0), 0u) << log.messages()[0];
}

TEST_F(SignedManifestTest, TheChainMustBeTrustedAndTheSignatureGood) {
  const std::string create = "-[VTRSignedManifest createPublicKey:usingPolicy:]: ";
  const std::string notValid = "-[VTRSignedManifest verifyManifestSignature:]: Certificate not valid.";
  SetFuse(1);
  const struct {
    const char* name;
    Bytes file;
    std::vector<std::string> messages;
  } cases[] = {
      {"a flipped payload byte",
       Signed(Payload(), {Pki("signer.der"), Pki("intermediate.der")}, Pki("signer.key"), Value::Integer(2), true),
       {"Verifing strong signing"}},
      {"signed by another key", Signed(Payload(), {Pki("signer.der"), Pki("intermediate.der")}, Pki("unfit.key")),
       {"Verifing strong signing"}},
      {"no intermediate", Signed(Payload(), {Pki("signer.der")}, Pki("signer.key")),
       {"Verifing strong signing", create + "certificate trust evaluation failed: 5", notValid}},
      {"a leaf unfit to sign", Signed(Payload(), {Pki("unfit.der"), Pki("intermediate.der")}, Pki("unfit.key")),
       {"Verifing strong signing", create + "certificate trust evaluation failed: 5", notValid}},
      {"test-signed on fused hardware", Signed(Payload(), {Pki("test-signer.der")}, Pki("test-signer.key")),
       {"Verifing strong signing", create + "certificate trust evaluation failed: 5", notValid}},
  };
  for (const auto& c : cases) {
    LogCapture log;
    EXPECT_FALSE(Read(c.file).has_value()) << c.name;
    EXPECT_EQ(log.messages(), c.messages) << c.name;
  }

  // A certificate that is not DER ends the attempt under the policy.
  Bytes garbled = Signed(Payload(), {Pki("signer.der")}, Pki("signer.key"));
  Result<Value> outer = ReadPropertyList(garbled);
  ASSERT_TRUE(outer.ok());
  DictionaryBuilder builder;
  for (const auto& [k, v] : *outer->dictionary()) {
    builder.add(k, k == "Certificate" ? Value::ArrayOf({Value::Data({0x30, 0x03, 1, 2})}) : v);
  }
  LogCapture log;
  EXPECT_FALSE(Read(*EncodeBinaryPropertyList(builder.build())));
  EXPECT_TRUE(log.contains("__49-[VTRSignedManifest createPublicKey:usingPolicy:]_block_invoke: Cannot load certificate."));
}

TEST_F(SignedManifestTest, DevelopmentSigningOnlyOnHardwareThatSaysItIsNotFused) {
  const Bytes testSigned = Signed(Payload(), {Pki("test-signer.der")}, Pki("test-signer.key"));
  for (const auto& [fuse, accepted] : {std::pair{1, false}, std::pair{-1, false}, std::pair{0, true}}) {
    SetFuse(fuse);
    LogCapture log;
    EXPECT_EQ(Read(testSigned).has_value(), accepted) << fuse;
    EXPECT_EQ(log.contains("Verifing development signing"), fuse == 0) << fuse;
  }
  // A truncated variable is no answer.
  WriteFile(efi_ / "SecureBoot-8be4df61-93ca-11d2-aa0d-00e098032b8c", std::string("\x06\x00\x00\x00", 4));
  EXPECT_EQ(SigningFuse(efi_.path()), std::nullopt);
  // Without anchors a policy cannot be created.
  anchors_.production = Pki("missing");
  LogCapture log;
  EXPECT_FALSE(Read(ProductionSigned(Payload())));
  EXPECT_TRUE(log.contains(std::string(kStrongFunction) + ": Cannot create policy."));
}

TEST_F(SignedManifestTest, OnlyRootOwnedAnchorsClosedToOthersAndReachedWithoutALinkCount) {
  if (!IsRoot()) GTEST_SKIP() << "needs root to own anchors";
  // A rogue root (the test root) planted next to the genuine one; a manifest
  // signed under it alone is trusted only where the rogue entry counts.
  const Bytes rogueSigned = Signed(Payload(), {Pki("test-signer.der")}, Pki("test-signer.key"));
  const std::string rogue = Pki("test/test-root.pem");
  const std::string copy = "cp '" + rogue + "' ";
  const struct {
    std::string plant;  // shell command; $A is the rogue entry's path
    const char* why;    // empty: the entry counts
  } cases[] = {
      {"ln -s '" + rogue + "' $A", "a symbolic link"},
      {copy + "$A && chown 501 $A", "owned by uid 501, not root"},
      {copy + "$A && chmod 0666 $A", "writable by group or others (mode 0666)"},
      {copy + "$A && chmod 0664 $A", "writable by group or others (mode 0664)"},
      {"mkfifo $A", "not a regular file"},
      {"mkdir $A", "not a regular file"},
      {copy + "$A && chmod 0644 $A", ""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.plant);
    TempDir folder;
    const std::string entry = folder / "rogue.pem";
    ASSERT_EQ(std::system(("cp '" + Pki("production/production-root.pem") + "' '" + folder.path() + "' && A='" +
                           entry + "' && " + c.plant).c_str()), 0);
    anchors_.production = folder.path();
    LogCapture log;
    EXPECT_EQ(Read(rogueSigned).has_value(), *c.why == '\0');
    EXPECT_EQ(log.contains(std::string(kStrongFunction) + ": " + entry + " is passed over: " + c.why + "."), *c.why != '\0');
    EXPECT_TRUE(Read(ProductionSigned(Payload())));
  }
  // A folder others may write is no policy at all.
  TempDir open;
  ASSERT_EQ(std::system(("cp '" + Pki("production/production-root.pem") + "' '" + open.path() + "' && chmod 0777 '" +
                         open.path() + "'").c_str()), 0);
  anchors_.production = open.path();
  LogCapture log;
  EXPECT_FALSE(Read(ProductionSigned(Payload())));
  EXPECT_TRUE(log.contains(std::string(kStrongFunction) + ": " + open.path() +
                           " is refused: writable by group or others (mode 0777)."));
  EXPECT_TRUE(log.contains(std::string(kStrongFunction) + ": Cannot create policy."));
}

TEST_F(SignedManifestTest, AnExpiredSignerIsNotTrusted) {
  // Issued by the intermediate, valid two years ago for a year.
  FILE* keyFile = std::fopen(Pki("intermediate.key").c_str(), "r");
  FILE* caFile = std::fopen(Pki("intermediate.pem").c_str(), "r");
  ASSERT_TRUE(keyFile && caFile);
  EVP_PKEY* caKey = PEM_read_PrivateKey(keyFile, nullptr, nullptr, nullptr);
  X509* ca = PEM_read_X509(caFile, nullptr, nullptr, nullptr);
  std::fclose(keyFile);
  std::fclose(caFile);
  X509* expired = X509_new();
  X509_set_version(expired, 2);
  ASN1_INTEGER_set(X509_get_serialNumber(expired), 99);
  X509_set_issuer_name(expired, X509_get_subject_name(ca));
  X509_NAME* subject = X509_NAME_new();
  X509_NAME_add_entry_by_txt(subject, "CN", MBSTRING_ASC, reinterpret_cast<const unsigned char*>("expired"), -1, -1, 0);
  X509_set_subject_name(expired, subject);
  X509_NAME_free(subject);
  X509_gmtime_adj(X509_getm_notBefore(expired), -2L * 365 * 86400);
  X509_gmtime_adj(X509_getm_notAfter(expired), -1L * 365 * 86400);
  X509_set_pubkey(expired, caKey);
  ASSERT_GT(X509_sign(expired, caKey, EVP_sha1()), 0);
  unsigned char* der = nullptr;
  const int length = i2d_X509(expired, &der);
  WriteFile(Pki("expired.der"), std::string(reinterpret_cast<char*>(der), static_cast<size_t>(length)));
  OPENSSL_free(der);
  X509_free(expired);
  X509_free(ca);
  EVP_PKEY_free(caKey);

  LogCapture log;
  EXPECT_FALSE(Read(Signed(Payload(), {Pki("expired.der"), Pki("intermediate.der")}, Pki("intermediate.key"))));
  EXPECT_TRUE(log.contains("-[VTRSignedManifest createPublicKey:usingPolicy:]: certificate trust evaluation failed: 5"));
}

}  // namespace
}  // namespace vtr
