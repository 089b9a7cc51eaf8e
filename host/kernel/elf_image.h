/* A module file's ELF structure, read with libelf from a copy of its bytes. Nothing in the file is
 * believed: what lies outside it, or is cut short, is a ModuleError. No state shared, no lock.
 */
#pragma once

#include <cstdint>
#include <filesystem>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

struct Elf;
struct Elf_Scn;

namespace host {

struct ElfSymbol {
  std::string name;
  uint64_t address; /* in the file's own numbering, from 0 */
  uint64_t size;
};

struct ElfSection {
  uint64_t address;
  std::string_view bytes; /* of the image that it came from */
};

class ElfImage {
 public:
  /* Throws ModuleError unless the file is a complete x86-64 shared object. */
  explicit ElfImage(const std::filesystem::path &path);

  std::optional<ElfSection> section(std::string_view name) const;

  /* The 64-bit word at an address, as relocation will leave it. */
  uint64_t wordAt(uint64_t address) const;

  /* The NUL-terminated string at an address. */
  std::string stringAt(uint64_t address) const;

  /* Can `size` bytes at an address be written once the file is mapped? */
  bool isWritable(uint64_t address, uint64_t size) const;

  /* Is there code that runs when the file is mapped or unmapped? */
  bool hasConstructors() const;

  /* Bytes of memory that the mapped file spans, from address 0. */
  uint64_t memorySize() const;

  std::vector<ElfSymbol> definedSymbols() const;     /* of .symtab, or else of .dynsym */
  std::vector<std::string> dynamicSymbols() const;   /* that the file defines for others */
  std::vector<std::string> undefinedSymbols() const; /* that others must define */

  /* Throws the ModuleError of this file. */
  [[noreturn]] void refuse(const std::string &why) const;

 private:
  struct Segment {
    uint64_t address, fileOffset, fileSize, memorySize;
    bool writable;
  };
  struct Symbol : ElfSymbol {
    bool defined, global;
    bool weak, visible;
  };

  void checkHeader() const;
  void readSegments();
  void checkSections() const;
  void readRelocations();
  std::vector<Symbol> symbolsOf(uint32_t sectionType) const;
  Elf_Scn *sectionOfType(uint32_t sectionType) const;
  const Segment *segmentOf(uint64_t address) const;

  std::filesystem::path path_;
  std::string bytes_;
  std::unique_ptr<Elf, int (*)(Elf *)> elf_;
  std::vector<Segment> segments_;
  std::map<uint64_t, uint64_t> relocations_; /* address of a word: its value */
};

}  // namespace host
