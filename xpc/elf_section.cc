#include "xpc/elf_section.h"

#include <gelf.h>
#include <libelf.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstring>
#include <memory>
#include <mutex>

#include "platform/format.h"

namespace vtr {
namespace {

struct ElfCloser {
  void operator()(Elf* elf) const { elf_end(elf); }
};
using ElfHandle = std::unique_ptr<Elf, ElfCloser>;

bool InitLibelf() {
  static std::once_flag once;
  static bool ready = false;
  std::call_once(once, [] { ready = elf_version(EV_CURRENT) != EV_NONE; });
  return ready;
}

Error ElfError(std::string_view what) { return Error::Invalid(Format("%s: %s", what, elf_errmsg(-1))); }

// libelf reads a section header table that lies past the end of the file as
// an empty one; such a file is malformed, not a file without the section.
Status CheckSectionTableInside(int fd, Elf* elf, size_t sections) {
  GElf_Ehdr header;
  if (gelf_getehdr(elf, &header) == nullptr) return ElfError("bad ELF header");
  struct stat st;
  if (::fstat(fd, &st) != 0) return Error::FromErrno("fstat");
  uint64_t size = static_cast<uint64_t>(st.st_size);
  if (header.e_shoff == 0 || header.e_shoff > size ||
      sections > (size - header.e_shoff) / std::max<uint64_t>(header.e_shentsize, 1)) {
    return Error::Invalid("section header table lies outside the file");
  }
  return Status::Ok();
}

}  // namespace

Result<std::optional<std::vector<uint8_t>>> ReadElfSection(int fd, std::string_view name, size_t maxBytes) {
  if (!InitLibelf()) return ElfError("libelf unavailable");
  ElfHandle elf(elf_begin(fd, ELF_C_READ, nullptr));
  if (!elf) return ElfError("cannot read ELF file");
  if (elf_kind(elf.get()) != ELF_K_ELF) return Error::Invalid("not an ELF file");
  size_t namesIndex = 0;
  size_t sections = 0;
  if (elf_getshdrstrndx(elf.get(), &namesIndex) != 0) return ElfError("no section names");
  if (elf_getshdrnum(elf.get(), &sections) != 0) return ElfError("no section count");
  if (Status inside = CheckSectionTableInside(fd, elf.get(), sections); !inside) return inside.error();

  Elf_Scn* found = nullptr;
  GElf_Shdr foundHeader = {};
  // By index rather than elf_nextscn(), which ends quietly where the section
  // header table cannot be read.
  for (size_t index = 1; index < sections; ++index) {
    Elf_Scn* scn = elf_getscn(elf.get(), index);
    GElf_Shdr header;
    if (scn == nullptr || gelf_getshdr(scn, &header) == nullptr) return ElfError("bad section header");
    const char* sectionName = elf_strptr(elf.get(), namesIndex, header.sh_name);
    if (sectionName == nullptr || name != sectionName) continue;
    if (found != nullptr) return Error::Invalid(Format("more than one %s section", name));
    found = scn;
    foundHeader = header;
  }
  if (found == nullptr) return std::optional<std::vector<uint8_t>>();
  if (foundHeader.sh_type == SHT_NOBITS) return Error::Invalid(Format("section %s holds no bytes", name));
  if (foundHeader.sh_size > maxBytes) {
    return Error::Invalid(Format("section %s of %zu bytes exceeds %zu", name, static_cast<size_t>(foundHeader.sh_size), maxBytes));
  }
  Elf_Data* data = elf_rawdata(found, nullptr);
  if (data == nullptr) return ElfError("cannot read section");
  if (data->d_size != foundHeader.sh_size || (data->d_size > 0 && data->d_buf == nullptr)) {
    return Error::Invalid(Format("section %s is cut short", name));
  }
  const auto* bytes = static_cast<const uint8_t*>(data->d_buf);
  return std::optional<std::vector<uint8_t>>(std::vector<uint8_t>(bytes, bytes + data->d_size));
}

}  // namespace vtr
