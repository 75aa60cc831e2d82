#include "host/symbolizer.h"

#include <cxxabi.h>
#include <dlfcn.h>
#include <elf.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
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

template <typename T>
std::optional<T> readAt(const std::vector<unsigned char> &bytes, uint64_t offset)
{
   if (offset > bytes.size() || bytes.size() - offset < sizeof(T)) {
      return std::nullopt;
   }
   T value;
   std::memcpy(&value, bytes.data() + offset, sizeof(T));
   return value;
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
   std::ifstream file(path, std::ios::binary);
   std::vector<unsigned char> bytes((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
   auto header = readAt<Elf64_Ehdr>(bytes, 0);
   if (!header || std::memcmp(header->e_ident, ELFMAG, SELFMAG) != 0 ||
       header->e_ident[EI_CLASS] != ELFCLASS64 || header->e_shentsize != sizeof(Elf64_Shdr)) {
      return result;
   }
   result.absolute = header->e_type == ET_EXEC;
   std::vector<Elf64_Shdr> sections;
   for (uint64_t i = 0; i < header->e_shnum; ++i) {
      auto section = readAt<Elf64_Shdr>(bytes, header->e_shoff + i * sizeof(Elf64_Shdr));
      if (!section) {
         return result;
      }
      sections.push_back(*section);
   }
   // The full table when the image has one, else the dynamic one.
   for (uint32_t wanted : {uint32_t{SHT_SYMTAB}, uint32_t{SHT_DYNSYM}}) {
      for (const auto &table : sections) {
         if (table.sh_type != wanted || table.sh_link >= sections.size() ||
             table.sh_offset > bytes.size() || bytes.size() - table.sh_offset < table.sh_size) {
            continue;
         }
         const Elf64_Shdr &strings = sections[table.sh_link];
         if (strings.sh_offset > bytes.size() || bytes.size() - strings.sh_offset < strings.sh_size) {
            continue;
         }
         const char *names = reinterpret_cast<const char *>(bytes.data() + strings.sh_offset);
         for (uint64_t at = 0; at + sizeof(Elf64_Sym) <= table.sh_size; at += sizeof(Elf64_Sym)) {
            auto symbol = readAt<Elf64_Sym>(bytes, table.sh_offset + at);
            if (!symbol || ELF64_ST_TYPE(symbol->st_info) != STT_FUNC || symbol->st_shndx == SHN_UNDEF ||
                symbol->st_value == 0 || symbol->st_name >= strings.sh_size) {
               continue;
            }
            const char *name = names + symbol->st_name;
            if (std::memchr(name, 0, strings.sh_size - symbol->st_name) == nullptr) {
               continue;
            }
            result.functions.push_back(Function{symbol->st_value, symbol->st_size, demangled(name)});
         }
         if (!result.functions.empty()) {
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
         return function.name + "+" + hex(key - function.start);
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
