// The configuration document: strict, so that a typo is an error rather
// than a silently different port.
#include "session/config_file.h"

#include "contract/config_record.h"
#include "session/error.h"
#include "session/ipv6_config.h"
#include "session/json_text.h"
#include "session/whole_file.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <nlohmann/json.hpp>

#include <algorithm>
#include <charconv>
#include <cstring>
#include <limits>

namespace swsec::session {

namespace {

using nlohmann::json;

struct FeatureName {
   std::string_view name;
   uint32_t bit;
};

constexpr FeatureName kFeatureNames[] = {
   {"bpdu-filter", SwSecFeatureBpduFilter},
   {"block-dhcp-server", SwSecFeatureBlockDhcpServer},
   {"ip-discovery", SwSecFeatureIpDiscovery},
   {"dai", SwSecFeatureDai},
   {"ip-source-guard", SwSecFeatureIpSrcGuard},
};

uint32_t unsignedField(const json &doc, const char *key, const std::string &origin)
{
   const json &value = doc.at(key);
   if (!value.is_number_unsigned() || value.get<uint64_t>() > std::numeric_limits<uint32_t>::max()) {
      throw InputError(origin + ": \"" + key + "\" must be an unsigned 32-bit integer");
   }
   return value.get<uint32_t>();
}

std::array<uint8_t, 4> parseIp(const json &value, const std::string &what)
{
   std::array<uint8_t, 4> ip{};
   if (!value.is_string() || inet_pton(AF_INET, value.get<std::string>().c_str(), ip.data()) != 1) {
      throw InputError(what + ": malformed IPv4 address " + session::jsonText(value));
   }
   return ip;
}

// An entry whose "ip" is an IPv6 address binds on the IPv6 agent.
void parseStatic(const json &entry, const std::string &what, PortSecurityConfig &config,
                 contract::Ipv6SecurityConfig &ipv6, bool &anyIpv6)
{
   if (!entry.is_object()) {
      throw InputError(what + ": expected an object {vlan, mac, ip}");
   }
   for (const auto &[key, value] : entry.items()) {
      if (key != "vlan" && key != "mac" && key != "ip") {
         throw InputError(what + ": unknown key \"" + key + "\"");
      }
   }
   if (!entry.contains("vlan") || !entry.contains("mac") || !entry.contains("ip")) {
      throw InputError(what + ": needs vlan, mac and ip");
   }
   StaticBinding binding;
   const json &vlan = entry["vlan"];
   if (!vlan.is_number_unsigned() || vlan.get<uint64_t>() > 4095) {
      throw InputError(what + ": \"vlan\" must be 0 to 4095");
   }
   binding.vlan = vlan.get<uint16_t>();
   if (!entry["mac"].is_string()) {
      throw InputError(what + ": \"mac\" must be a string");
   }
   binding.mac = parseMac(entry["mac"].get<std::string>(), what);
   const json &ip = entry["ip"];
   if (ip.is_string() && ip.get<std::string>().find(':') != std::string::npos) {
      ipv6.statics.push_back(ipv6StaticKey(binding.vlan, binding.mac, ip, what));
      anyIpv6 = true;
      return;
   }
   binding.ip = parseIp(ip, what);
   config.statics.push_back(binding);
}

// Names an ethertype list may use beside numbers ("0x0800" or 2048).
constexpr std::pair<std::string_view, uint16_t> kEtherTypeNames[] = {
   {"ipv4", 0x0800}, {"arp", 0x0806}, {"ipv6", 0x86dd}, {"rarp", 0x8035}, {"lldp", 0x88cc},
};

uint16_t parseEtherType(const json &value, const std::string &what)
{
   uint64_t number = 0;
   bool ok = value.is_number_unsigned();
   if (ok) {
      number = value.get<uint64_t>();
   } else if (value.is_string()) {
      const std::string text = value.get<std::string>();
      for (const auto &[name, type] : kEtherTypeNames) {
         if (text == name) {
            return type;
         }
      }
      const char *first = text.data() + 2;
      const auto [end, error] = std::from_chars(first, text.data() + text.size(), number, 16);
      ok = text.size() > 2 && text.size() <= 6 && text.starts_with("0x") && error == std::errc{} &&
           end == text.data() + text.size();
   }
   // Values below 0x0600 are an 802.3 length, not a type a frame can name.
   if (!ok || number < 0x0600 || number > 0xffff) {
      throw InputError(what + ": " + session::jsonText(value) +
                        " is not an ethertype (0x0600 to 0xffff, or ipv4, arp, ipv6, rarp, lldp)");
   }
   return static_cast<uint16_t>(number);
}

std::vector<uint16_t> parseEtherTypes(const json &value, const std::string &origin)
{
   if (!value.is_array() || value.empty() || value.size() > SWSEC_ETHERTYPES_MAX) {
      throw InputError(origin + ": \"etherTypes\" must list 1 to " + std::to_string(SWSEC_ETHERTYPES_MAX) +
                        " ethertypes (leave it out to allow any)");
   }
   std::vector<uint16_t> types;
   for (size_t i = 0; i < value.size(); ++i) {
      const uint16_t type = parseEtherType(value[i], origin + ": etherTypes[" + std::to_string(i) + "]");
      if (std::find(types.begin(), types.end(), type) != types.end()) {
         throw InputError(origin + ": etherTypes[" + std::to_string(i) + "]: " + session::jsonText(value[i]) + " is listed twice");
      }
      types.push_back(type);
   }
   return types;
}

}  // namespace

std::array<uint8_t, 6> parseMac(std::string_view text, const std::string &what)
{
   std::array<uint8_t, 6> mac{};
   bool ok = text.size() == 17;
   for (size_t i = 0; ok && i < 6; ++i) {
      const char *first = text.data() + i * 3;
      auto [end, error] = std::from_chars(first, first + 2, mac[i], 16);
      ok = error == std::errc{} && end == first + 2 && (i == 5 || text[i * 3 + 2] == ':');
   }
   if (!ok) {
      throw InputError(what + ": malformed MAC address \"" + std::string(text) + "\"");
   }
   return mac;
}

PortSecurityConfig parseConfig(std::string_view text, const std::string &origin)
{
   if (session::jsonDepth(text) > session::kMaxJsonDepth) {
      throw InputError(origin + ": nested deeper than " + std::to_string(session::kMaxJsonDepth) + " levels");
   }
   json doc;
   try {
      doc = json::parse(text);
   } catch (const json::parse_error &e) {
      throw InputError(origin + ": bad JSON: " + e.what());
   } catch (const json::exception &e) {
      // A number too large for any type (1e400): the library's message
      // without its exception tag.
      const std::string what = e.what();
      const size_t tag = what.find("] ");
      throw InputError(origin + ": bad JSON: " + (tag == std::string::npos ? what : what.substr(tag + 2)));
   }
   if (!doc.is_object()) {
      throw InputError(origin + ": expected a JSON object");
   }
   PortSecurityConfig config;
   config.origin = origin;
   contract::Ipv6SecurityConfig ipv6;
   bool anyIpv6 = false;
   for (const auto &[key, value] : doc.items()) {
      if (key == "features") {
         if (!value.is_array()) {
            throw InputError(origin + ": \"features\" must be a list of feature names");
         }
         config.features = 0;
         ipv6.features = 0;
         for (const auto &name : value) {
            if (const uint32_t bit = name.is_string() ? ipv6FeatureBit(name.get<std::string>()) : 0; bit != 0) {
               ipv6.features |= bit;
               anyIpv6 = true;
               continue;
            }
            const FeatureName *found = nullptr;
            for (const auto &feature : kFeatureNames) {
               if (name.is_string() && name.get<std::string>() == feature.name) {
                  found = &feature;
               }
            }
            if (found == nullptr) {
               throw InputError(origin + ": unknown feature " + session::jsonText(name) +
                                 " (known: ip-discovery, dai, ip-source-guard, bpdu-filter, block-dhcp-server, " +
                                kIpv6FeatureNames + ")");
            }
            config.features |= found->bit;
         }
      } else if (key == "trusted") {
         if (!value.is_boolean()) {
            throw InputError(origin + ": \"trusted\" must be true or false");
         }
         config.trusted = value.get<bool>();
      } else if (key == "portDbSize") {
         config.portDbSize = unsignedField(doc, "portDbSize", origin);
      } else if (key == "arpRateLimit") {
         config.arpRateLimit = unsignedField(doc, "arpRateLimit", origin);
      } else if (key == "errRateLimit") {
         config.errRateLimit = unsignedField(doc, "errRateLimit", origin);
      } else if (key == "errRateLimitPeriod") {
         config.errRateLimitPeriod = unsignedField(doc, "errRateLimitPeriod", origin);
      } else if (key == "allowTagged") {
         if (!value.is_boolean()) {
            throw InputError(origin + ": \"allowTagged\" must be true or false");
         }
         config.allowTagged = value.get<bool>();
      } else if (key == "etherTypes") {
         config.etherTypes = parseEtherTypes(value, origin);
      } else if (key == "static") {
         if (!value.is_array()) {
            throw InputError(origin + ": \"static\" must be a list of {vlan, mac, ip}");
         }
         for (size_t i = 0; i < value.size(); ++i) {
            parseStatic(value[i], origin + ": static[" + std::to_string(i) + "]", config, ipv6, anyIpv6);
         }
      } else if (parseIpv6Number(key, value, ipv6, origin)) {
         anyIpv6 = true;
      } else {
         throw InputError(origin + ": unknown key \"" + key + "\"");
      }
   }
   if (anyIpv6) {
      // The port's mode and the error state's rate and period are the same for both agents.
      ipv6.trusted = config.trusted;
      ipv6.errRateLimit = config.errRateLimit;
      ipv6.errRateLimitPeriod = config.errRateLimitPeriod;
      config.ipv6 = std::move(ipv6);
   }
   return config;
}

std::string readConfigText(const std::string &path)
{
   // Non-blocking so that a FIFO does not wait for a writer before the
   // reader refuses it; a link is followed to its file.
   const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
   if (fd < 0) {
      throw InputError(path + ": cannot open: " + std::strerror(errno));
   }
   std::vector<uint8_t> bytes;
   if (const auto refusal = readWholeFile(fd, path, kMaxConfigFileBytes, "a configuration", bytes)) {
      throw InputError(*refusal);
   }
   return std::string(bytes.begin(), bytes.end());
}

PortSecurityConfig loadConfigFile(const std::string &path)
{
   return parseConfig(readConfigText(path), path);
}

}  // namespace swsec::session
