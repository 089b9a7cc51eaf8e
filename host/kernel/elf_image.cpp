/* A module file's ELF structure, through libelf. No state shared, no lock. */
#include "host/kernel/elf_image.h"

#include <gelf.h>
#include <libelf.h>

#include <algorithm>
#include <cinttypes>
#include <cstring>
#include <fstream>
#include <limits>

#include "host/kernel/module_file.h"
#include "host/kernel/text.h"

namespace host {
namespace {

/* Far above any module: a file that is not one is not read whole to find that out. */
constexpr uintmax_t kLargestFile = 256u << 20;

std::string readFile(const std::filesystem::path &path) {
  const auto refuse = [&path](const std::string &why) {
    throw ModuleError(path.string() + ": " + why);
  };
  std::error_code error;
  const auto status = std::filesystem::status(path, error);
  if (!std::filesystem::exists(status)) refuse("there is no such file; check the path");
  if (!std::filesystem::is_regular_file(status)) refuse("is not a file; name a module file (.so)");
  const uintmax_t size = std::filesystem::file_size(path, error);
  if (size > kLargestFile) refuse("is larger than any module; name a module file (.so)");
  std::ifstream file(path, std::ios::binary);
  std::string bytes(size, '\0');
  file.read(bytes.data(), static_cast<std::streamsize>(size));
  if (!file) refuse("cannot be read; check its permissions");
  return bytes;
}

/* Does [offset, offset + size) lie within [0, limit)? */
bool fits(uint64_t offset, uint64_t size, uint64_t limit) {
  return offset <= limit && size <= limit - offset;
}

template <typename Item>
size_t itemsIn(const Elf_Data *data) {
  const size_t most = std::numeric_limits<int>::max();
  return data == nullptr ? 0 : std::min(data->d_size / sizeof(Item), most);
}

}  // namespace

ElfImage::ElfImage(const std::filesystem::path &path)
    : path_(path), bytes_(readFile(path)), elf_(nullptr, elf_end) {
  elf_version(EV_CURRENT);
  elf_.reset(elf_memory(bytes_.data(), bytes_.size()));
  checkHeader();
  checkSections();
  readSegments();
  readRelocations();
}

void ElfImage::refuse(const std::string &why) const {
  throw ModuleError(path_.string() + ": " + why);
}

void ElfImage::checkHeader() const {
  GElf_Ehdr header;
  if (!elf_ || elf_kind(elf_.get()) != ELF_K_ELF || gelf_getehdr(elf_.get(), &header) == nullptr) {
    refuse("is not an ELF file; name a module file (.so)");
  }
  if (header.e_ident[EI_CLASS] != ELFCLASS64 || header.e_ident[EI_DATA] != ELFDATA2LSB ||
      header.e_machine != EM_X86_64) {
    refuse("is built for another machine; build it for x86-64");
  }
  if (header.e_type != ET_DYN) refuse("is not a shared object; link it with -shared");
  const uint64_t fileSize = bytes_.size();
  if (!fits(header.e_shoff, uint64_t{header.e_shnum} * header.e_shentsize, fileSize) ||
      !fits(header.e_phoff, uint64_t{header.e_phnum} * header.e_phentsize, fileSize)) {
    refuse("is cut short; build or copy it again");
  }
}

void ElfImage::checkSections() const {
  for (Elf_Scn *at = elf_nextscn(elf_.get(), nullptr); at; at = elf_nextscn(elf_.get(), at)) {
    GElf_Shdr header;
    if (gelf_getshdr(at, &header) == nullptr) refuse("has a broken section table; build it again");
    if (header.sh_type == SHT_NOBITS) continue;
    if (!fits(header.sh_offset, header.sh_size, bytes_.size())) {
      refuse("is cut short: a section lies outside; build or copy it again");
    }
  }
}

void ElfImage::readSegments() {
  size_t count = 0;
  if (elf_getphdrnum(elf_.get(), &count) != 0) count = 0;
  for (size_t i = 0; i < count; i++) {
    GElf_Phdr header;
    if (gelf_getphdr(elf_.get(), static_cast<int>(i), &header) == nullptr) {
      refuse("has a broken segment table; build it again");
    }
    if (header.p_type != PT_LOAD) continue;
    if (!fits(header.p_offset, header.p_filesz, bytes_.size()) ||
        header.p_filesz > header.p_memsz ||
        !fits(header.p_vaddr, header.p_memsz, std::numeric_limits<int64_t>::max())) {
      refuse("is cut short: a segment lies outside; build or copy it again");
    }
    segments_.push_back({header.p_vaddr, header.p_offset, header.p_filesz, header.p_memsz,
                         (header.p_flags & PF_W) != 0});
  }
  if (segments_.empty()) refuse("has nothing to load; link it with -shared");
}

void ElfImage::readRelocations() {
  const std::vector<Symbol> symbols = symbolsOf(SHT_DYNSYM);
  for (Elf_Scn *at = elf_nextscn(elf_.get(), nullptr); at; at = elf_nextscn(elf_.get(), at)) {
    GElf_Shdr header;
    if (gelf_getshdr(at, &header) == nullptr || header.sh_type != SHT_RELA) continue;
    Elf_Data *const data = elf_getdata(at, nullptr);
    for (size_t i = 0; i < itemsIn<Elf64_Rela>(data); i++) {
      GElf_Rela relocation;
      if (gelf_getrela(data, static_cast<int>(i), &relocation) == nullptr) break;
      const auto addend = static_cast<uint64_t>(relocation.r_addend);
      const uint64_t type = GELF_R_TYPE(relocation.r_info);
      const uint64_t symbol = GELF_R_SYM(relocation.r_info);
      if (type == R_X86_64_RELATIVE) {
        relocations_[relocation.r_offset] = addend;
      } else if (type == R_X86_64_64 && symbol < symbols.size() && symbols[symbol].defined) {
        relocations_[relocation.r_offset] = symbols[symbol].address + addend;
      }
    }
  }
}

std::optional<ElfSection> ElfImage::section(std::string_view name) const {
  size_t names = 0;
  if (elf_getshdrstrndx(elf_.get(), &names) != 0) refuse("has no section names; do not strip them");
  for (Elf_Scn *at = elf_nextscn(elf_.get(), nullptr); at; at = elf_nextscn(elf_.get(), at)) {
    GElf_Shdr header;
    if (gelf_getshdr(at, &header) == nullptr || header.sh_type == SHT_NOBITS) continue;
    const char *const own = elf_strptr(elf_.get(), names, header.sh_name);
    if (own == nullptr || own != name) continue;
    return ElfSection{header.sh_addr,
                      std::string_view(bytes_).substr(header.sh_offset, header.sh_size)};
  }
  return std::nullopt;
}

const ElfImage::Segment *ElfImage::segmentOf(uint64_t address) const {
  const auto found = std::find_if(segments_.begin(), segments_.end(), [=](const Segment &segment) {
    return address >= segment.address && address - segment.address < segment.memorySize;
  });
  return found == segments_.end() ? nullptr : &*found;
}

uint64_t ElfImage::wordAt(uint64_t address) const {
  const auto relocated = relocations_.find(address);
  if (relocated != relocations_.end()) return relocated->second;
  const Segment *const segment = segmentOf(address);
  uint64_t word = 0;
  if (segment == nullptr || !fits(address - segment->address, sizeof word, segment->fileSize)) {
    refuse(formatText("a table points outside of it, to 0x%" PRIx64 "; build it again", address));
  }
  std::memcpy(&word, &bytes_[segment->fileOffset + (address - segment->address)], sizeof word);
  return word;
}

std::string ElfImage::stringAt(uint64_t address) const {
  const Segment *const segment = segmentOf(address);
  if (segment == nullptr || address - segment->address >= segment->fileSize) {
    refuse(formatText("a string lies outside of it, at 0x%" PRIx64 "; build it again", address));
  }
  const uint64_t offset = address - segment->address;
  const std::string_view rest =
      std::string_view(bytes_).substr(segment->fileOffset + offset, segment->fileSize - offset);
  const size_t length = rest.find('\0');
  if (length == std::string_view::npos) {
    refuse(formatText("the string at 0x%" PRIx64 " does not end; build it again", address));
  }
  return std::string(rest.substr(0, length));
}

bool ElfImage::isWritable(uint64_t address, uint64_t size) const {
  const Segment *const segment = segmentOf(address);
  return segment != nullptr && segment->writable &&
         fits(address - segment->address, size, segment->memorySize);
}

uint64_t ElfImage::memorySize() const {
  uint64_t end = 0;
  for (const Segment &segment : segments_)
    end = std::max(end, segment.address + segment.memorySize);
  return end;
}

Elf_Scn *ElfImage::sectionOfType(uint32_t sectionType) const {
  for (Elf_Scn *at = elf_nextscn(elf_.get(), nullptr); at; at = elf_nextscn(elf_.get(), at)) {
    GElf_Shdr header;
    if (gelf_getshdr(at, &header) != nullptr && header.sh_type == sectionType) return at;
  }
  return nullptr;
}

bool ElfImage::hasConstructors() const {
  return sectionOfType(SHT_INIT_ARRAY) != nullptr || sectionOfType(SHT_FINI_ARRAY) != nullptr ||
         section(".init") || section(".fini");
}

std::vector<ElfImage::Symbol> ElfImage::symbolsOf(uint32_t sectionType) const {
  std::vector<Symbol> symbols;
  Elf_Scn *const section = sectionOfType(sectionType);
  if (section == nullptr) return symbols;
  GElf_Shdr header;
  gelf_getshdr(section, &header);
  Elf_Data *const data = elf_getdata(section, nullptr);
  for (size_t i = 0; i < itemsIn<Elf64_Sym>(data); i++) {
    GElf_Sym symbol;
    if (gelf_getsym(data, static_cast<int>(i), &symbol) == nullptr) break;
    const char *const name = elf_strptr(elf_.get(), header.sh_link, symbol.st_name);
    const auto binding = GELF_ST_BIND(symbol.st_info);
    const auto visibility = GELF_ST_VISIBILITY(symbol.st_other);
    Symbol read;
    read.name = name == nullptr ? "" : name;
    read.address = symbol.st_value;
    read.size = symbol.st_size;
    read.defined = symbol.st_shndx != SHN_UNDEF && symbol.st_shndx != SHN_ABS;
    read.global = binding == STB_GLOBAL;
    read.weak = binding == STB_WEAK;
    read.visible = visibility == STV_DEFAULT || visibility == STV_PROTECTED;
    symbols.push_back(std::move(read));
  }
  return symbols;
}

std::vector<ElfSymbol> ElfImage::definedSymbols() const {
  std::vector<ElfSymbol> defined;
  const bool stripped = sectionOfType(SHT_SYMTAB) == nullptr;
  for (Symbol &symbol : symbolsOf(stripped ? SHT_DYNSYM : SHT_SYMTAB)) {
    if (symbol.defined && !symbol.name.empty()) defined.push_back(std::move(symbol));
  }
  return defined;
}

std::vector<std::string> ElfImage::dynamicSymbols() const {
  std::vector<std::string> names;
  for (Symbol &symbol : symbolsOf(SHT_DYNSYM)) {
    if (symbol.defined && symbol.visible && (symbol.global || symbol.weak) &&
        !symbol.name.empty()) {
      names.push_back(std::move(symbol.name));
    }
  }
  return names;
}

std::vector<std::string> ElfImage::undefinedSymbols() const {
  std::vector<std::string> names;
  for (Symbol &symbol : symbolsOf(SHT_DYNSYM)) {
    if (!symbol.defined && symbol.global && !symbol.name.empty()) {
      names.push_back(std::move(symbol.name));
    }
  }
  return names;
}

}  // namespace host
