// A throwaway PKI made with the openssl tool, once per test program, and
// signed manifests made with it: a production root and a test root (SHA-1
// signed, as in the format's era), an intermediate, a signer fit to sign
// ("signer"), one whose key may only encipher ("unfit"), and a signer under
// the test root ("test-signer"). Nothing of it is committed.
#ifndef VTR_TESTS_SUPPORT_TEST_PKI_H_
#define VTR_TESTS_SUPPORT_TEST_PKI_H_

#include <string>
#include <vector>

#include "platform/plist.h"
#include "platform/value.h"

namespace vtr::testing {

// A property list's bytes in format.
Bytes Encode(const Value& value, PlistFormat format);

class TestPki {
 public:
  // The PKI of this test program, made on first use. A test fails (and
  // this answers a PKI without files) when the openssl tool fails.
  static const TestPki& Get();

  // A file of the PKI: "production" and "test" are the anchor folders;
  // NAME.der, NAME.pem and NAME.key for each certificate above.
  std::string file(const std::string& name) const { return folder_ + "/" + name; }

  // The signature the openssl tool makes of bytes with the key file.
  static Bytes Sign(const Bytes& bytes, const std::string& keyFile);

  // A signed manifest file's bytes: payload signed with keyFile, the
  // certificates of chain (names of .der files, leaf first); the file and
  // its payload in the formats given.
  Bytes signedManifest(const Value& payload, const std::vector<std::string>& chain, const std::string& key,
                       Value version = Value::Integer(2), bool flipPayload = false,
                       PlistFormat outer = PlistFormat::kBinary, PlistFormat inner = PlistFormat::kBinary) const;
  // Signed by "signer" with its intermediate.
  Bytes productionSigned(const Value& payload, PlistFormat outer = PlistFormat::kBinary,
                         PlistFormat inner = PlistFormat::kBinary) const;

 private:
  TestPki();
  std::string folder_;
};

}  // namespace vtr::testing

#endif  // VTR_TESTS_SUPPORT_TEST_PKI_H_
