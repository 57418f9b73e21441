#include "ElfFile.h"

#include <cstring>
#include <filesystem>
#include <fstream>
#include <stdexcept>

namespace rolvane::test {

ElfFile::ElfFile(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    _bytes.resize(std::filesystem::file_size(path));
    file.read(_bytes.data(), static_cast<std::streamsize>(_bytes.size()));
    if (_bytes.size() < sizeof _header || _bytes.compare(0, SELFMAG, ELFMAG) != 0 || _bytes[EI_CLASS] != ELFCLASS64)
        throw std::runtime_error(path + " is no ELF file of 64 bits");
    std::memcpy(&_header, _bytes.data(), sizeof _header);
    _segments = table<Elf64_Phdr>(_header.e_phoff, _header.e_phnum);
    _sections = table<Elf64_Shdr>(_header.e_shoff, _header.e_shnum);
}

std::string_view ElfFile::part(uint64_t offset, uint64_t size) const {
    if (offset > _bytes.size() || size > _bytes.size() - offset) throw std::runtime_error("the ELF file is cut short");
    return std::string_view(_bytes).substr(offset, size);
}

template <class T>
std::vector<T> ElfFile::table(uint64_t offset, uint64_t count) const {
    const std::string_view from = part(offset, count * sizeof(T));
    std::vector<T> entries(count);
    if (count) std::memcpy(entries.data(), from.data(), from.size());
    return entries;
}

std::string ElfFile::nameIn(const Elf64_Shdr& names, uint32_t at) const {
    const std::string_view all = text(names);
    if (at >= all.size()) throw std::runtime_error("the ELF file is damaged");
    return std::string(all.substr(at, all.find('\0', at) - at));
}

const Elf64_Phdr* ElfFile::segment(uint32_t type) const {
    for (const Elf64_Phdr& each : _segments)
        if (each.p_type == type) return &each;
    return nullptr;
}

const Elf64_Shdr* ElfFile::section(std::string_view name) const {
    for (const Elf64_Shdr& each : _sections)
        if (nameIn(_sections.at(_header.e_shstrndx), each.sh_name) == name) return &each;
    return nullptr;
}

bool ElfFile::hasSection(std::string_view name) const {
    return section(name) != nullptr;
}

uint64_t ElfFile::dynamic(int64_t tag) const {
    const Elf64_Shdr* found = section(".dynamic");
    if (!found) return 0;
    for (const auto& entry : table<Elf64_Dyn>(found->sh_offset, found->sh_size / sizeof(Elf64_Dyn)))
        if (entry.d_tag == tag) return entry.d_un.d_val;
    return 0;
}

std::vector<std::string> ElfFile::imports() const {
    std::vector<std::string> names;
    const Elf64_Shdr* symbols = section(".dynsym");
    const Elf64_Shdr* texts = section(".dynstr");
    if (!symbols || !texts) return names;
    for (const auto& symbol : table<Elf64_Sym>(symbols->sh_offset, symbols->sh_size / sizeof(Elf64_Sym)))
        if (symbol.st_shndx == SHN_UNDEF && symbol.st_name) names.push_back(nameIn(*texts, symbol.st_name));
    return names;
}

std::vector<ElfFile::Function> ElfFile::functions() const {
    std::vector<Function> all;
    const Elf64_Shdr* symbols = section(".symtab");
    const Elf64_Shdr* texts = section(".strtab");
    if (!symbols || !texts) return all;
    for (const auto& symbol : table<Elf64_Sym>(symbols->sh_offset, symbols->sh_size / sizeof(Elf64_Sym))) {
        if (ELF64_ST_TYPE(symbol.st_info) != STT_FUNC || symbol.st_shndx == SHN_UNDEF ||
            symbol.st_shndx >= _sections.size() || symbol.st_size < 4)
            continue;
        const Elf64_Shdr& code = _sections[symbol.st_shndx];
        all.push_back(
            {nameIn(*texts, symbol.st_name), std::string(part(symbol.st_value - code.sh_addr + code.sh_offset, 4))});
    }
    return all;
}

} // namespace rolvane::test
