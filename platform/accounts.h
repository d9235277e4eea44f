// The account database: user and group names and their numeric ids, read
// from passwd and group files.
//
// The helper reads the files itself instead of asking the C library's name
// service, because the daemon chroots into its sandbox root, where the name
// service modules can no longer be loaded; the daemon loads the database
// before the chroot and installs it with SetShared(). After loading, every
// lookup is a map search: no file is read again, so a name is resolved once
// per id for the life of the database.
//
// Thread safety: an AccountDatabase is immutable after Load()/Parse() and may
// be read from any thread. Shared()/SetShared() are safe to call concurrently.
#ifndef VTR_PLATFORM_ACCOUNTS_H_
#define VTR_PLATFORM_ACCOUNTS_H_

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>

#include "platform/result.h"

namespace vtr {

// Largest passwd or group file Load() reads.
inline constexpr size_t kMaxAccountFileBytes = size_t{16} << 20;

class AccountDatabase {
 public:
  // An empty database: every lookup answers nothing.
  AccountDatabase() = default;

  // Reads both files (regular files of at most kMaxAccountFileBytes each;
  // a fifo or device is refused without blocking) and parses them as Parse()
  // does. Fails when either file cannot be read.
  static Result<AccountDatabase> Load(const std::string& passwdPath, const std::string& groupPath);

  // Parses passwd text ("name:password:uid:gid:...") and group text
  // ("name:password:gid:members"). Lines that do not have that shape (too few
  // fields, an empty name, a "+"/"-" name-service entry, an id that is not a
  // decimal number below 2^32-1) are skipped. Where a name or an id stands
  // more than once, its first line counts, as the C library's lookups do.
  static AccountDatabase Parse(std::string_view passwdText, std::string_view groupText);

  std::optional<uid_t> userId(std::string_view name) const;
  // The user's name, or null when uid has none. Valid while the database lives.
  const std::string* userName(uid_t uid) const;
  std::optional<gid_t> groupId(std::string_view name) const;
  // The group's name, or null when gid has none. Valid while the database lives.
  const std::string* groupName(gid_t gid) const;

  // The process-wide database: the one installed with SetShared(), or else
  // /etc/passwd and /etc/group loaded on first use (an empty database when
  // they cannot be read). The pointer keeps the database alive however often
  // SetShared() is called meanwhile.
  static std::shared_ptr<const AccountDatabase> Shared();
  // Installs the process-wide database (the daemon does so before chroot);
  // null puts back the default of loading /etc on next use.
  static void SetShared(std::shared_ptr<const AccountDatabase> database);

 private:
  // One direction of a database: names to ids and ids to names.
  struct Table {
    std::map<std::string, uint32_t, std::less<>> idByName;
    std::unordered_map<uint32_t, std::string> nameById;
    void add(std::string_view name, uint32_t id);
  };
  // Adds the lines of text whose id stands in field idField.
  static void ParseInto(std::string_view text, size_t idField, Table* table);

  Table users_;
  Table groups_;
};

}  // namespace vtr

#endif  // VTR_PLATFORM_ACCOUNTS_H_
