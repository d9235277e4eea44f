#include "platform/accounts.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <mutex>
#include <utility>

#include "platform/read_fully.h"
#include "platform/unique_fd.h"

namespace vtr {
namespace {

// The whole content of a regular file of at most kMaxAccountFileBytes.
// O_NONBLOCK keeps a fifo planted at the path from blocking the open.
Result<std::string> ReadAccountFile(const std::string& path) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  if (!fd) return Error::FromErrno(path);
  struct stat st;
  if (::fstat(fd.get(), &st) != 0) return Error::FromErrno(path);
  if (!S_ISREG(st.st_mode)) return Error(EINVAL, path + " is not a regular file");
  if (static_cast<uint64_t>(st.st_size) > kMaxAccountFileBytes) return Error(EFBIG, path);
  Result<std::string> text = ReadFully(fd.get(), kMaxAccountFileBytes);
  if (!text.ok()) return Error(text.error().code(), path);
  return text;
}

// A decimal id below 2^32-1 ((uid_t)-1 means "no id" to the kernel).
std::optional<uint32_t> ParseId(std::string_view text) {
  if (text.empty() || text.size() > 10) return std::nullopt;
  uint64_t value = 0;
  for (char c : text) {
    if (c < '0' || c > '9') return std::nullopt;
    value = value * 10 + static_cast<uint64_t>(c - '0');
  }
  if (value >= UINT32_MAX) return std::nullopt;
  return static_cast<uint32_t>(value);
}

std::mutex sharedMutex;
std::shared_ptr<const AccountDatabase> sharedDatabase;

}  // namespace

void AccountDatabase::Table::add(std::string_view name, uint32_t id) {
  idByName.emplace(std::string(name), id);  // emplace keeps the first entry
  nameById.emplace(id, std::string(name));
}

void AccountDatabase::ParseInto(std::string_view text, size_t idField, Table* table) {
  while (!text.empty()) {
    const size_t newline = text.find('\n');
    std::string_view line = text.substr(0, newline);
    text = newline == std::string_view::npos ? std::string_view() : text.substr(newline + 1);

    std::string_view fields[4];
    size_t count = 0;
    while (count <= idField) {
      const size_t colon = line.find(':');
      fields[count++] = line.substr(0, colon);
      if (colon == std::string_view::npos) break;
      line.remove_prefix(colon + 1);
    }
    if (count <= idField) continue;
    const std::string_view name = fields[0];
    if (name.empty() || name.front() == '+' || name.front() == '-') continue;
    if (std::optional<uint32_t> id = ParseId(fields[idField])) table->add(name, *id);
  }
}

AccountDatabase AccountDatabase::Parse(std::string_view passwdText, std::string_view groupText) {
  AccountDatabase db;
  ParseInto(passwdText, 2, &db.users_);
  ParseInto(groupText, 2, &db.groups_);
  return db;
}

Result<AccountDatabase> AccountDatabase::Load(const std::string& passwdPath, const std::string& groupPath) {
  Result<std::string> passwd = ReadAccountFile(passwdPath);
  if (!passwd.ok()) return passwd.error();
  Result<std::string> group = ReadAccountFile(groupPath);
  if (!group.ok()) return group.error();
  return Parse(*passwd, *group);
}

std::optional<uid_t> AccountDatabase::userId(std::string_view name) const {
  auto it = users_.idByName.find(name);
  if (it == users_.idByName.end()) return std::nullopt;
  return it->second;
}

const std::string* AccountDatabase::userName(uid_t uid) const {
  auto it = users_.nameById.find(uid);
  return it == users_.nameById.end() ? nullptr : &it->second;
}

std::optional<gid_t> AccountDatabase::groupId(std::string_view name) const {
  auto it = groups_.idByName.find(name);
  if (it == groups_.idByName.end()) return std::nullopt;
  return it->second;
}

const std::string* AccountDatabase::groupName(gid_t gid) const {
  auto it = groups_.nameById.find(gid);
  return it == groups_.nameById.end() ? nullptr : &it->second;
}

std::shared_ptr<const AccountDatabase> AccountDatabase::Shared() {
  std::lock_guard<std::mutex> lock(sharedMutex);
  if (!sharedDatabase) {
    Result<AccountDatabase> loaded = Load("/etc/passwd", "/etc/group");
    sharedDatabase = std::make_shared<const AccountDatabase>(loaded.ok() ? std::move(*loaded) : AccountDatabase());
  }
  return sharedDatabase;
}

void AccountDatabase::SetShared(std::shared_ptr<const AccountDatabase> database) {
  std::lock_guard<std::mutex> lock(sharedMutex);
  sharedDatabase = std::move(database);
}

}  // namespace vtr
