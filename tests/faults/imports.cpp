#include "imports.h"

#include <elf.h>
#include <link.h>

#include <algorithm>
#include <fstream>
#include <sstream>

namespace {

// The parts of a shared object's dynamic section that describe its symbols.
struct Symbols {
  const ElfW(Sym) * table = nullptr;
  const char* names = nullptr;
  const uint32_t* hash = nullptr;
};

Symbols symbolsOf(const dl_phdr_info& info) {
  Symbols symbols;
  for (int segment = 0; segment < info.dlpi_phnum; ++segment) {
    const ElfW(Phdr)& header = info.dlpi_phdr[segment];
    if (header.p_type != PT_DYNAMIC) continue;
    // The loader has made the addresses absolute.
    for (auto* entry = reinterpret_cast<const ElfW(Dyn)*>(info.dlpi_addr + header.p_vaddr);
         entry->d_tag != DT_NULL; ++entry) {
      const auto address = entry->d_un.d_ptr;
      if (entry->d_tag == DT_SYMTAB) symbols.table = reinterpret_cast<const ElfW(Sym)*>(address);
      if (entry->d_tag == DT_STRTAB) symbols.names = reinterpret_cast<const char*>(address);
      if (entry->d_tag == DT_GNU_HASH) symbols.hash = reinterpret_cast<const uint32_t*>(address);
    }
  }
  return symbols;
}

std::string nameInSource(std::string name) {
  const std::string fortified = "_chk";
  if (name.starts_with("__") && name.ends_with(fortified)) {
    name = name.substr(2, name.size() - 2 - fortified.size());
  }
  const std::string c23 = "__isoc23_";
  return name.starts_with(c23) ? name.substr(c23.size()) : name;
}

struct Search {
  const std::string& name;
  std::set<std::string> imports;
};

int addImports(dl_phdr_info* info, size_t, void* argument) {
  auto* const search = static_cast<Search*>(argument);
  const std::string path = info->dlpi_name;
  if (!path.substr(path.rfind('/') + 1).starts_with(search->name)) return 0;
  const Symbols symbols = symbolsOf(*info);
  if (symbols.table == nullptr || symbols.names == nullptr || symbols.hash == nullptr) return 0;
  // Undefined symbols are not in the hash table; they precede those that are.
  const uint32_t first_hashed = symbols.hash[1];
  for (uint32_t number = 1; number < first_hashed; ++number) {
    const ElfW(Sym)& symbol = symbols.table[number];
    if (symbol.st_shndx == SHN_UNDEF) {
      search->imports.insert(nameInSource(symbols.names + symbol.st_name));
    }
  }
  return 1;
}

}  // namespace

std::set<std::string> importsOf(const std::string& name) {
  Search search = {name, {}};
  dl_iterate_phdr(addImports, &search);
  return search.imports;
}

bool KnownImports::has(const std::string& import) const {
  if (failing.contains(import) || others.contains(import)) return true;
  return std::any_of(others.begin(), others.end(), [&](const std::string& other) {
    return other.ends_with('*') && import.starts_with(other.substr(0, other.size() - 1));
  });
}

KnownImports knownImports() {
  KnownImports known;
  std::ifstream list(IMPORTS);
  std::set<std::string>* section = nullptr;
  for (std::string line; std::getline(list, line);) {
    if (line.empty() || line.front() == '#') continue;
    const size_t colon = line.find(':');
    if (colon != std::string::npos) {
      section = line.substr(0, colon) == "fails" ? &known.failing : &known.others;
      line.erase(0, colon + 1);
    }
    std::istringstream words(line);
    for (std::string word; section != nullptr && words >> word;) section->insert(word);
  }
  return known;
}
