// Function symbols from a module file's symbol table (see ElfSymbols.h).
#include "crashreport/ElfSymbols.h"

#include <elf.h>
#include <fcntl.h>
#include <link.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <cstring>

#include "crashreport/ReportLine.h"

namespace Tracewright {
namespace {

struct MappedFile {
    char path[PATH_MAX] = {};
    const unsigned char* data = nullptr;  // whole file, read-only; null when not mapped
    size_t size = 0;                      // bytes mapped
};

MappedFile cached;  // the last module file looked up

bool mapFile(const char* path) {
    if (cached.data != nullptr && std::strcmp(cached.path, path) == 0) return true;
    if (cached.data != nullptr) munmap(const_cast<unsigned char*>(cached.data), cached.size);
    cached.data = nullptr;
    cached.path[0] = '\0';
    int fd = open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0) return false;
    struct stat status {};
    void* memory = MAP_FAILED;
    if (fstat(fd, &status) == 0 && status.st_size > static_cast<off_t>(sizeof(ElfW(Ehdr)))) {
        memory = mmap(nullptr, static_cast<size_t>(status.st_size), PROT_READ, MAP_PRIVATE, fd, 0);
    }
    close(fd);
    if (memory == MAP_FAILED) return false;
    cached.data = static_cast<const unsigned char*>(memory);
    cached.size = static_cast<size_t>(status.st_size);
    CopyText(cached.path, sizeof(cached.path), path);
    return true;
}

// True when [offset, offset + length) lies inside the mapped file.
bool inside(uint64_t offset, uint64_t length) {
    return offset <= cached.size && length <= cached.size - offset;
}

// Looks for the function covering `address` among the symbols of one table, whose names are in
// `strings`; both already checked to lie inside the file.
bool searchSymbols(const ElfW(Shdr) & table, const ElfW(Shdr) & strings, uint64_t address,
                   char* name, size_t size, uint64_t* displacement) {
    const auto* symbols = reinterpret_cast<const ElfW(Sym)*>(cached.data + table.sh_offset);
    const size_t symbolCount = table.sh_size / sizeof(ElfW(Sym));
    for (size_t k = 0; k < symbolCount; ++k) {
        const ElfW(Sym)& symbol = symbols[k];
        const unsigned kind = ELF64_ST_TYPE(symbol.st_info);
        if (kind != STT_FUNC && kind != STT_GNU_IFUNC) continue;
        if (symbol.st_shndx == SHN_UNDEF || symbol.st_name >= strings.sh_size) continue;
        const bool covers = symbol.st_size == 0 ? address == symbol.st_value
                                                : address >= symbol.st_value &&
                                                      address - symbol.st_value < symbol.st_size;
        if (!covers) continue;
        const char* text =
            reinterpret_cast<const char*>(cached.data + strings.sh_offset + symbol.st_name);
        const size_t room = strings.sh_size - symbol.st_name;  // the name ends inside the table
        size_t length = 0;
        while (length < room && text[length] != '\0') ++length;
        if (length == room) continue;
        CopyText(name, size, text);
        *displacement = address - symbol.st_value;
        return true;
    }
    return false;
}

// Looks in every symbol table section of type `type`.
bool searchTable(const ElfW(Shdr) * sections, unsigned count, unsigned type, uint64_t address,
                 char* name, size_t size, uint64_t* displacement) {
    for (unsigned i = 0; i < count; ++i) {
        const ElfW(Shdr)& table = sections[i];
        if (table.sh_type != type || table.sh_entsize != sizeof(ElfW(Sym))) continue;
        if (table.sh_link >= count || !inside(table.sh_offset, table.sh_size)) continue;
        const ElfW(Shdr)& strings = sections[table.sh_link];
        if (!inside(strings.sh_offset, strings.sh_size)) continue;
        if (searchSymbols(table, strings, address, name, size, displacement)) return true;
    }
    return false;
}

}  // namespace

bool FindFunctionSymbol(const char* path, uint64_t fileAddress, char* name, size_t size,
                        uint64_t* displacement) {
    if (path == nullptr || path[0] == '\0' || !mapFile(path)) return false;
    const auto* header = reinterpret_cast<const ElfW(Ehdr)*>(cached.data);
    if (std::memcmp(header->e_ident, ELFMAG, SELFMAG) != 0 ||
        header->e_ident[EI_CLASS] != ELFCLASS64 || header->e_shentsize != sizeof(ElfW(Shdr)) ||
        !inside(header->e_shoff, uint64_t{header->e_shnum} * sizeof(ElfW(Shdr)))) {
        return false;
    }
    const auto* sections = reinterpret_cast<const ElfW(Shdr)*>(cached.data + header->e_shoff);
    return searchTable(sections, header->e_shnum, SHT_SYMTAB, fileAddress, name, size,
                       displacement) ||
           searchTable(sections, header->e_shnum, SHT_DYNSYM, fileAddress, name, size,
                       displacement);
}

}  // namespace Tracewright
