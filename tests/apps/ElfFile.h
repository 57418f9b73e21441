#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include <elf.h>

namespace rolvane::test {

// A program or a shared object as the linker left it (64 bits). Throws std::runtime_error when the file is none. What
// is read is checked against the file's size.
class ElfFile {
public:
    explicit ElfFile(const std::string& path);

    uint16_t type() const { return _header.e_type; } // ET_DYN for programs that can lie anywhere in memory
    uint16_t machine() const { return _header.e_machine; }
    const Elf64_Phdr* segment(uint32_t type) const; // null: there is none
    bool hasSection(std::string_view name) const;
    // The value of an entry of the dynamic section, 0 when it is missing.
    uint64_t dynamic(int64_t tag) const;
    // The names of the symbols that other files have to give.
    std::vector<std::string> imports() const;
    // Functions of the file's own symbol table: name, and the first four bytes of their code.
    struct Function {
        std::string name, start;
    };
    std::vector<Function> functions() const;

private:
    std::string_view part(uint64_t offset, uint64_t size) const;
    std::string_view text(const Elf64_Shdr& section) const { return part(section.sh_offset, section.sh_size); }
    const Elf64_Shdr* section(std::string_view name) const;
    std::string nameIn(const Elf64_Shdr& names, uint32_t at) const;
    template <class T>
    std::vector<T> table(uint64_t offset, uint64_t count) const;

    std::string _bytes;
    Elf64_Ehdr _header{};
    std::vector<Elf64_Phdr> _segments;
    std::vector<Elf64_Shdr> _sections;
};

} // namespace rolvane::test
