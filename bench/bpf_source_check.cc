#include "bpf_source_check.h"

#include <cstdio>
#include <stdexcept>

namespace swsec::bench {

namespace {

std::string macText(const testing::Mac &mac)
{
   char text[18];
   std::snprintf(text, sizeof text, "%02x:%02x:%02x:%02x:%02x:%02x", mac.bytes[0], mac.bytes[1], mac.bytes[2],
                 mac.bytes[3], mac.bytes[4], mac.bytes[5]);
   return text;
}

std::string ipText(const testing::Ip4 &ip)
{
   return std::to_string(ip.bytes[0]) + "." + std::to_string(ip.bytes[1]) + "." + std::to_string(ip.bytes[2]) +
          "." + std::to_string(ip.bytes[3]);
}

}  // namespace

BpfSourceCheck::BpfSourceCheck(const std::vector<Binding> &bindings)
{
   expression_ = "not ip or udp dst port 67";
   for (const auto &binding : bindings) {
      expression_ += " or (ether src " + macText(binding.mac) + " and ip src " + ipText(binding.ip) + ")";
   }
   pcap_ = pcap_open_dead(DLT_EN10MB, 65535);
   if (pcap_ == nullptr) {
      throw std::runtime_error("pcap_open_dead failed");
   }
   if (pcap_compile(pcap_, &program_, expression_.c_str(), 1, PCAP_NETMASK_UNKNOWN) != 0) {
      const std::string error = pcap_geterr(pcap_);
      pcap_close(pcap_);
      throw std::runtime_error("pcap_compile: " + error);
   }
}

BpfSourceCheck::~BpfSourceCheck()
{
   pcap_freecode(&program_);
   pcap_close(pcap_);
}

uint32_t BpfSourceCheck::run(const std::vector<testing::Bytes> &frames) const
{
   uint32_t drops = 0;
   pcap_pkthdr header{};
   for (const auto &frame : frames) {
      header.caplen = static_cast<bpf_u_int32>(frame.size());
      header.len = header.caplen;
      if (pcap_offline_filter(&program_, &header, frame.data()) == 0) {
         ++drops;
      }
   }
   return drops;
}

}  // namespace swsec::bench
