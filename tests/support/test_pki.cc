#include "tests/support/test_pki.h"

#include <unistd.h>

#include <cstdlib>

#include <gtest/gtest.h>

#include "platform/plist.h"
#include "tests/support/test_support.h"

namespace vtr::testing {
namespace {

constexpr char kMakePki[] = R"(set -e
mkdir -p production test
printf 'basicConstraints=critical,CA:TRUE\nkeyUsage=critical,keyCertSign\n' > ca.ext
printf 'keyUsage=critical,digitalSignature\n' > signer.ext
printf 'keyUsage=critical,keyEncipherment\n' > unfit.ext
root() { openssl req -x509 -newkey rsa:2048 -nodes -sha1 -days 3650 -keyout "$1.key" -out "$1.pem" -subj "/CN=$1" \
  -addext 'basicConstraints=critical,CA:TRUE' -addext 'keyUsage=critical,keyCertSign' 2>/dev/null; }
issue() { openssl req -newkey rsa:2048 -nodes -keyout "$1.key" -out "$1.csr" -subj "/CN=$1" 2>/dev/null
  openssl x509 -req -sha1 -days 365 -in "$1.csr" -CA "$2.pem" -CAkey "$2.key" -CAcreateserial -out "$1.pem" \
    -extfile "$3" 2>/dev/null
  openssl x509 -in "$1.pem" -outform DER -out "$1.der"; }
root production-root; root test-root
cp production-root.pem production/; cp test-root.pem test/
issue intermediate production-root ca.ext
issue signer intermediate signer.ext
issue unfit intermediate unfit.ext
issue test-signer test-root signer.ext
)";

Bytes FileBytes(const std::string& path) {
  const std::string text = ReadFile(path);
  return Bytes(text.begin(), text.end());
}

}  // namespace

const TestPki& TestPki::Get() {
  static const TestPki* const pki = new TestPki();
  return *pki;
}

// The folder of the program's one PKI, removed when the program ends, but
// not by a child it forked that ends through exit().
class PkiFolder {
 public:
  const std::string& path() const { return folder_.path(); }
  ~PkiFolder() {
    if (::getpid() != owner_) folder_.keep();
  }

 private:
  TempDir folder_;
  pid_t owner_ = ::getpid();
};

TestPki::TestPki() {
  static PkiFolder folder;
  folder_ = folder.path();
  WriteFile(folder_ + "/make-pki.sh", kMakePki);
  const std::string command = "cd '" + folder_ + "' && sh make-pki.sh";
  EXPECT_EQ(std::system(command.c_str()), 0) << "the openssl tool failed";
}

Bytes TestPki::Sign(const Bytes& bytes, const std::string& keyFile) {
  TempDir work;
  WriteFile(work / "payload", std::string(bytes.begin(), bytes.end()));
  const std::string command = "openssl dgst -sha1 -sign '" + keyFile + "' -out '" + (work / "sig") + "' '" +
                              (work / "payload") + "'";
  EXPECT_EQ(std::system(command.c_str()), 0);
  return FileBytes(work / "sig");
}

Bytes Encode(const Value& value, PlistFormat format) {
  if (format == PlistFormat::kBinary) return *EncodeBinaryPropertyList(value);
  const std::string xml = *EncodeXmlPropertyList(value);
  return Bytes(xml.begin(), xml.end());
}

Bytes TestPki::signedManifest(const Value& payload, const std::vector<std::string>& chain, const std::string& key,
                              Value version, bool flipPayload, PlistFormat outer, PlistFormat inner) const {
  Bytes payloadBytes = Encode(payload, inner);
  const Bytes signature = Sign(payloadBytes, file(key));
  if (flipPayload) payloadBytes[payloadBytes.size() / 2] ^= 1;
  Array certificates;
  for (const std::string& der : chain) certificates.push_back(Value::Data(FileBytes(file(der))));
  return Encode(Value::DictionaryOf({{"Version", version},
                                     {"Certificate", Value::ArrayOf(certificates)},
                                     {"Payload", Value::Data(payloadBytes)},
                                     {"Signature", Value::Data(signature)}}),
                outer);
}

Bytes TestPki::productionSigned(const Value& payload, PlistFormat outer, PlistFormat inner) const {
  return signedManifest(payload, {"signer.der", "intermediate.der"}, "signer.key", Value::Integer(2), false, outer,
                        inner);
}

}  // namespace vtr::testing
