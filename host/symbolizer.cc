#include "host/symbolizer.h"

#include <cxxabi.h>
#include <dlfcn.h>
#include <elf.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <memory>
#include <optional>

namespace swsec::host {

namespace {

// "ns::f(int, char*) const" -> "ns::f": the parameter list says nothing
// that the offset does not, and makes reports hard to read.
std::string withoutParameters(std::string name)
{
   if (!name.ends_with(")") && !name.ends_with(") const")) {
      return name;
   }
   int depth = 0;
   for (size_t i = name.size(); i-- > 0;) {
      if (name[i] == ')') {
         ++depth;
      } else if (name[i] == '(') {
         if (--depth == 0) {
            name.resize(i);
            return name;
         }
      }
   }
   return name;
}

std::string demangled(const char *name)
{
   int status = 0;
   std::unique_ptr<char, decltype(&std::free)> text(abi::__cxa_demangle(name, nullptr, nullptr, &status),
                                                     &std::free);
   if (status != 0 || !text) {
      return name;
   }
   return withoutParameters(text.get());
}

// Reads `count` records of T at `offset` of the file, or nothing when they
// do not lie wholly within its `size` bytes.
template <typename T>
std::optional<std::vector<T>> readAt(std::ifstream &file, uint64_t size, uint64_t offset, uint64_t count)
{
   if (offset > size || count > (size - offset) / sizeof(T)) {
      return std::nullopt;
   }
   std::vector<T> records(count);
   file.seekg(static_cast<std::streamoff>(offset));
   file.read(reinterpret_cast<char *>(records.data()), static_cast<std::streamsize>(count * sizeof(T)));
   if (!file) {
      return std::nullopt;
   }
   return records;
}

std::string hex(uint64_t value)
{
   char text[24];
   std::snprintf(text, sizeof text, "0x%llx", static_cast<unsigned long long>(value));
   return text;
}

}  // namespace

const Symbolizer::Image &Symbolizer::image(const std::string &path)
{
   auto found = images_.find(path);
   if (found != images_.end()) {
      return found->second;
   }
   Image &result = images_[path];
   // Only the headers and the symbol table are read, not the whole image: a
   // program with the module linked in and debug information is tens of
   // megabytes, and names are demangled only for the addresses described.
   std::ifstream file(path, std::ios::binary | std::ios::ate);
   if (!file) {
      return result;
   }
   const uint64_t size = static_cast<uint64_t>(file.tellg());
   auto header = readAt<Elf64_Ehdr>(file, size, 0, 1);
   if (!header || std::memcmp((*header)[0].e_ident, ELFMAG, SELFMAG) != 0 ||
       (*header)[0].e_ident[EI_CLASS] != ELFCLASS64 || (*header)[0].e_shentsize != sizeof(Elf64_Shdr)) {
      return result;
   }
   result.absolute = (*header)[0].e_type == ET_EXEC;
   auto sections = readAt<Elf64_Shdr>(file, size, (*header)[0].e_shoff, (*header)[0].e_shnum);
   if (!sections) {
      return result;
   }
   // The full table when the image has one, else the dynamic one.
   for (uint32_t wanted : {uint32_t{SHT_SYMTAB}, uint32_t{SHT_DYNSYM}}) {
      for (const auto &table : *sections) {
         if (table.sh_type != wanted || table.sh_link >= sections->size()) {
            continue;
         }
         const Elf64_Shdr &strings = (*sections)[table.sh_link];
         auto symbols = readAt<Elf64_Sym>(file, size, table.sh_offset, table.sh_size / sizeof(Elf64_Sym));
         auto names = readAt<char>(file, size, strings.sh_offset, strings.sh_size);
         if (!symbols || !names) {
            continue;
         }
         for (const Elf64_Sym &symbol : *symbols) {
            if (ELF64_ST_TYPE(symbol.st_info) != STT_FUNC || symbol.st_shndx == SHN_UNDEF ||
                symbol.st_value == 0 || symbol.st_name >= names->size() ||
                std::memchr(names->data() + symbol.st_name, 0, names->size() - symbol.st_name) == nullptr) {
               continue;
            }
            result.functions.push_back(Function{symbol.st_value, symbol.st_size, symbol.st_name});
         }
         if (!result.functions.empty()) {
            result.names.assign(names->begin(), names->end());
            break;
         }
      }
      if (!result.functions.empty()) {
         break;
      }
   }
   std::sort(result.functions.begin(), result.functions.end(),
             [](const Function &a, const Function &b) { return a.start < b.start; });
   return result;
}

std::string Symbolizer::describe(const void *address)
{
   Dl_info info{};
   if (address == nullptr || dladdr(address, &info) == 0 || info.dli_fname == nullptr) {
      return hex(reinterpret_cast<uintptr_t>(address));
   }
   const uint64_t absolute = reinterpret_cast<uintptr_t>(address);
   const uint64_t relative = absolute - reinterpret_cast<uintptr_t>(info.dli_fbase);
   std::lock_guard guard(mutex_);
   const Image &found = image(info.dli_fname);
   const uint64_t key = found.absolute ? absolute : relative;
   auto next = std::upper_bound(found.functions.begin(), found.functions.end(), key,
                                [](uint64_t value, const Function &f) { return value < f.start; });
   if (next != found.functions.begin()) {
      const Function &function = *std::prev(next);
      if (key - function.start < std::max<uint64_t>(function.size, 1)) {
         return demangled(found.names.c_str() + function.nameOffset) + "+" + hex(key - function.start);
      }
   }
   std::string file = info.dli_fname;
   auto slash = file.rfind('/');
   if (slash != std::string::npos) {
      file.erase(0, slash + 1);
   }
   return file + "+" + hex(relative);
}

void Symbolizer::forget()
{
   std::lock_guard guard(mutex_);
   images_.clear();
}

}  // namespace swsec::host
