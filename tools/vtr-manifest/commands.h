// The commands of vtr-manifest, each run from parsed options. Results go to
// `out`, diagnostics to `console` (standard error); the return value is the
// process's exit status.
#ifndef VTR_TOOLS_VTR_MANIFEST_COMMANDS_H_
#define VTR_TOOLS_VTR_MANIFEST_COMMANDS_H_

#include <cstdio>
#include <optional>
#include <utility>
#include <string>
#include <vector>

#include "model/signed_manifest.h"
#include "tools/common/tool_conventions.h"
#include "tools/vtr-manifest/console.h"

namespace vtr::manifest_tool {

// The tools' common exit statuses (kExitOk; kExitNo: compare found
// differences, show no such entry; kExitUsage, kExitBadInput, kExitNoInput,
// kExitIoError), and verify's own, by cause: what keeps a signed manifest
// from being trusted.
using namespace vtr::tools;
inline constexpr int kExitMalformed = 3;           // not a signed manifest of the expected form
inline constexpr int kExitUnsupportedVersion = 4;  // outer or payload version not read
inline constexpr int kExitNotTrusted = 5;          // no policy trusts the certificate chain
inline constexpr int kExitBadSignature = 6;        // the signature does not sign the payload

// What is walked, and how, for create and compare.
struct WalkOptions {
  std::string tree;
  std::optional<std::string> relativeTo;  // default: the tree itself
  bool inclusive = false;
  std::vector<std::string> skip;
  std::optional<unsigned> jobs;  // record threads; default: the builder's
};

struct CreateOptions {
  WalkOptions walk;
  std::string output;
};

enum class ShowFormat { kText, kJson, kXml };

// Which manifest of a file to use: the file itself, or in a signed manifest
// the whole-device manifest or one container's.
struct ManifestSelection {
  std::string file;
  std::optional<std::string> container;
};

struct ShowOptions {
  ManifestSelection manifest;
  ShowFormat format = ShowFormat::kText;
  std::optional<std::string> path;
};

struct CompareOptions {
  ManifestSelection manifest;
  WalkOptions walk;
  bool json = false;  // one JSON document instead of lines
};

// A signed manifest made of manifests: the payload holds the whole-device
// manifest as "Backup" and each container's under its list.
struct SignOptions {
  std::string manifest;
  std::vector<std::pair<std::string, std::string>> appData;  // (identifier, manifest file)
  std::vector<std::pair<std::string, std::string>> groupData;
  std::vector<std::pair<std::string, std::string>> extensionData;
  std::string key;                        // PEM private key
  std::vector<std::string> certificates;  // PEM or DER, leaf first
  std::string output;
  int32_t payloadVersion = 3;
  std::string info;  // the payload's "Info" description
  bool xml = false;  // XML file and payload instead of binary
};

struct VerifyOptions {
  std::string file;
  SigningAnchors anchors;
  bool json = false;  // the verdict as a JSON document
};

struct InspectOptions {
  std::string file;
  bool json = false;
};

// Writes the manifest of the tree to options.output ("-": standard output),
// streamed exactly as the helper writes the device manifest, keyed by the
// items' paths below the tree's canonical path. 0 when every item was
// described and the file written; nothing is written when an item could not
// be (kExitBadInput: a name that is not UTF-8; kExitIoError: unreadable).
int RunCreate(const CreateOptions& options, Console& console);

// Prints a manifest (or one entry of it) in the chosen format.
int RunShow(const ShowOptions& options, FILE* out, Console& console);

// Walks the tree as create does (the manifest file itself left out when it
// lies in the tree) and compares each item with the manifest's record of
// it: "PATH changed" and a line per differing key ("\tKEY expected OLD,
// found NEW", see record_differences.h), "PATH missing" for an entry nothing
// on disk matched, "PATH extra" for an item the manifest lacks; or all of it
// as one JSON document. 0 only when nothing differs; an item that could not
// be described fails as in create.
int RunCompare(const CompareOptions& options, FILE* out, Console& console);

// Builds the payload of options' manifests, signs it and writes the signed
// manifest to options.output ("-": standard output). A key that does not
// belong to the first certificate is refused (kExitBadInput).
int RunSign(const SignOptions& options, Console& console);

// Reads the signed manifest as the helper does, with its messages, and
// answers by cause: 0 trusted and well signed, else kExitMalformed,
// kExitUnsupportedVersion, kExitNotTrusted, kExitBadSignature, or
// kExitNoInput when the file or the trust anchors' folder cannot be used.
int RunVerify(const VerifyOptions& options, FILE* out, Console& console);

// Prints the outer fields of a signed manifest (version, each certificate's
// subject, issuer and validity, the signature's size) and a summary of its
// payload, as text or JSON. The signature is not checked.
int RunInspect(const InspectOptions& options, FILE* out, Console& console);

}  // namespace vtr::manifest_tool

#endif  // VTR_TOOLS_VTR_MANIFEST_COMMANDS_H_
