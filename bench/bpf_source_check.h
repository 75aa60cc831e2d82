// The stateless source check as a classic BPF program compiled by libpcap:
// a frame passes when it is not IPv4, is on its way to a DHCP server, or
// comes from one of the bound (MAC, IPv4) pairs.
#pragma once

#include "frame_mix.h"

#include <pcap/pcap.h>

#include <cstdint>
#include <string>
#include <vector>

namespace swsec::bench {

class BpfSourceCheck {
public:
   explicit BpfSourceCheck(const std::vector<Binding> &bindings);
   ~BpfSourceCheck();
   BpfSourceCheck(const BpfSourceCheck &) = delete;
   BpfSourceCheck &operator=(const BpfSourceCheck &) = delete;

   // Judges every frame; returns how many would be dropped.
   uint32_t run(const std::vector<testing::Bytes> &frames) const;

   const std::string &expression() const { return expression_; }

private:
   std::string expression_;
   pcap_t *pcap_ = nullptr;
   bpf_program program_{};
};

}  // namespace swsec::bench
