// Names code addresses for reports: heap calling sites, timer callbacks.
//
// Module functions have hidden visibility, so the dynamic symbol table
// (all that dladdr sees) does not know them; the symbolizer reads the
// image's full symbol table from its file, once per image.
#pragma once

#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <vector>

namespace swsec::host {

class Symbolizer {
public:
   // "function+0x1c" when the address lies in a known function, else
   // "image.so+0x1234", else the bare address.
   std::string describe(const void *address);
   // Drops what was read: an image was closed and its addresses may be
   // reused by the next one.
   void forget();

private:
   struct Function {
      uint64_t start = 0;
      uint64_t size = 0;
      uint64_t nameOffset = 0;   // into the image's string table
   };
   struct Image {
      bool absolute = false;   // an executable linked at fixed addresses
      std::vector<Function> functions;   // by start address
      std::string names;   // the symbol table's strings; demangled only when asked for
   };

   const Image &image(const std::string &path);

   std::mutex mutex_;
   std::map<std::string, Image> images_;
};

}  // namespace swsec::host
