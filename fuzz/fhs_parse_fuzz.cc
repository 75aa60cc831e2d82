// The IPv6 header chain walker, the DHCPv6 parser and the address text
// parser on arbitrary bytes.
// Each gets an exact-size copy, so that a read past what it was given is
// an AddressSanitizer report.
//
// Input: [view cut, 1 byte] [packet...]: the walker sees the packet with the
// cut's number of bytes left out of its view; the parser sees the packet.
#include "fhs/fhs_dhcpv6.h"
#include "fhs/fhs_ipv6_chain.h"
#include "fhs/fhs_nexo.h"

#include <cstdint>
#include <cstdlib>
#include <memory>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
   if (size < 1 || size > 70000) {
      return 0;
   }
   const uint32_t length = static_cast<uint32_t>(size - 1);
   const uint32_t cut = data[0] < length ? data[0] : length;
   std::vector<uint8_t> view(data + 1, data + 1 + (length - cut));
   FhsIpv6Chain chain{};
   const FhsChainVerdict verdict = FhsWalkIpv6Chain(view.data(), uint32_t(view.size()), length, &chain);
   if (verdict == FhsChainOk && chain.laterFragment == 0 && chain.upperOffset > chain.packetLen) {
      std::abort();
   }
   if (cut == 0 && verdict == FhsChainNeedView) {
      std::abort();   // a whole packet always suffices
   }

   std::vector<uint8_t> message(data + 1, data + size);
   FhsDhcpv6Msg msg;
   if (FhsDhcpv6Parse(message.data(), length, &msg) == 0 && msg.clientId != nullptr &&
       (msg.clientId < message.data() || msg.clientId + msg.clientIdLen > message.data() + length)) {
      std::abort();
   }

   std::vector<char> text(data + 1, data + size);
   text.push_back('\0');
   uint8_t addr[16];
   (void)FhsParseIpv6(text.data(), addr);
   return 0;
}
