#include "fastpath.h"

#include <bpf/bpf.h>
#include <bpf/libbpf.h>
#include <linux/pkt_cls.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <utility>

namespace swsec::fastpath {
namespace {

constexpr long kBpfFsMagic = 0xcafe4a11;
constexpr const char *kPinnedMaps[] = {"swsec_port", "swsec_bindings", "swsec_bindings6", "swsec_counters", "swsec_punts"};

#define SWSEC_FP_REASON_NAME(name, text) text,
constexpr std::string_view kReasonNames[] = {SWSEC_FP_REASON_LIST(SWSEC_FP_REASON_NAME)};
#undef SWSEC_FP_REASON_NAME
static_assert(std::size(kReasonNames) == SWSEC_FP_REASON_COUNT);

// A libbpf options record (LIBBPF_OPTS is a C macro): zeroed, its size set.
template <class Options>
Options optionsOf()
{
   Options options{};
   options.sz = sizeof(Options);
   return options;
}

// libbpf answers with a negative errno, or null and errno set.
int check(int result, const std::string &what)
{
   if (result < 0) {
      throw Error(what, -result);
   }
   return result;
}

swsec_fp_binding_key keyOf(const Binding &binding)
{
   swsec_fp_binding_key key{};
   key.vlan = binding.vlan;
   std::memcpy(key.mac, binding.mac.data(), sizeof key.mac);
   key.ip = binding.ip;
   return key;
}

swsec_fp_binding6_key keyOf(const Binding6 &binding)
{
   swsec_fp_binding6_key key{};
   key.vlan = binding.vlan;
   std::memcpy(key.mac, binding.mac.data(), sizeof key.mac);
   std::memcpy(key.addr, binding.addr.data(), sizeof key.addr);
   return key;
}

// The punts a second a VM may cause for a module's rate limit (0: none, no budget).
uint32_t puntBudget(uint32_t rateLimit)
{
   const uint64_t punts = std::max<uint64_t>(SWSEC_FP_ARP_PUNT_FLOOR, uint64_t{rateLimit} * SWSEC_FP_ARP_PUNT_FACTOR);
   return rateLimit == 0 ? 0 : static_cast<uint32_t>(std::min<uint64_t>(punts, UINT32_MAX));
}

void makePinDir(const std::string &dir)
{
   std::error_code error;
   std::filesystem::create_directories(dir, error);
   if (error) {
      throw Error("cannot make " + dir, error.value());
   }
   struct statfs fs {};
   if (statfs(dir.c_str(), &fs) != 0) {
      throw Error("cannot read " + dir, errno);
   }
   if (fs.f_type != kBpfFsMagic) {
      throw Error(dir + " is not on a BPF file system (mount -t bpf bpf /sys/fs/bpf)", ENOTSUP);
   }
}

// A map pinned by a run of an older program whose layout differs (a killed
// run before an upgrade) cannot be reused: it is unpinned, and the program
// it served keeps it until the new one replaces that on the hooks.
void dropStalePin(const bpf_map *map, const std::string &path)
{
   const int fd = bpf_obj_get(path.c_str());
   if (fd < 0) {
      return;   // none pinned there
   }
   bpf_map_info info{};
   uint32_t length = sizeof info;
   const bool same = bpf_obj_get_info_by_fd(fd, &info, &length) == 0 && info.type == bpf_map__type(map) &&
                     info.key_size == bpf_map__key_size(map) && info.value_size == bpf_map__value_size(map) &&
                     info.max_entries == bpf_map__max_entries(map);
   ::close(fd);
   if (!same && ::unlink(path.c_str()) != 0) {
      throw Error("cannot unpin the stale map " + path, errno);
   }
}

// A ring buffer record, read only within `size`.
int takePunt(void *context, void *data, size_t size)
{
   auto *sink = static_cast<std::function<void(Punt &&)> *>(context);
   swsec_fp_punt head{};
   if (size < sizeof head) {
      return 0;
   }
   std::memcpy(&head, data, sizeof head);
   if (head.captured > size - sizeof head) {
      return 0;
   }
   const auto *bytes = static_cast<const uint8_t *>(data) + sizeof head;
   Punt punt;
   punt.portId = head.port_id;
   punt.direction = head.direction;
   punt.vlan = head.vlan;
   punt.reason = head.reason;
   if ((head.flags & SWSEC_FP_PUNT_HAS_TAG) != 0) {
      punt.tpid = (head.flags & SWSEC_FP_PUNT_TPID_8021AD) != 0 ? 0x88a8 : (head.flags & SWSEC_FP_PUNT_TPID_9100) != 0 ? 0x9100 : 0x8100;
      punt.tagHigh = head.tag_high;
   }
   punt.frameLen = head.frame_len;
   punt.truncated = head.captured < head.frame_len;
   // One copy around the tag: the addresses, then what follows it.
   const size_t tag = (head.flags & SWSEC_FP_PUNT_TAG_IN_BYTES) != 0 && head.captured >= 18 ? 4 : 0;
   const size_t addresses = tag != 0 ? 12 : 0;
   punt.bytes.resize(head.captured - tag);
   if (punt.bytes.empty()) {
      return 0;   // the program punts no empty frame
   }
   std::memcpy(punt.bytes.data(), bytes, addresses);
   std::memcpy(punt.bytes.data() + addresses, bytes + addresses + tag, head.captured - tag - addresses);
   if (*sink) {
      (*sink)(std::move(punt));
   }
   return 0;
}

std::mutex logMutex;
std::function<void(std::string_view)> logSink;

// libbpf's own format and arguments, formatted as libbpf would.
[[gnu::format(printf, 2, 0)]] int printLibbpf(libbpf_print_level level, const char *format, va_list arguments)
{
   if (level == LIBBPF_DEBUG) {
      return 0;
   }
   char text[1024];
   const int length = std::vsnprintf(text, sizeof text, format, arguments);
   std::string_view message(text, length < 0 ? 0 : std::min<size_t>(static_cast<size_t>(length), sizeof text - 1));
   while (!message.empty() && message.back() == '\n') {
      message.remove_suffix(1);
   }
   if (message.find("Exclusivity flag on") != std::string_view::npos) {
      return 0;   // the clsact qdisc exists already: attaching uses it
   }
   const std::lock_guard lock(logMutex);
   if (logSink) {
      logSink(message);
   } else {
      std::fprintf(stderr, "%.*s\n", static_cast<int>(message.size()), message.data());
   }
   return 0;
}

void installLibbpfLog()
{
   static std::once_flag once;
   std::call_once(once, [] { libbpf_set_print(printLibbpf); });
}

}  // namespace

void setLibbpfLog(std::function<void(std::string_view)> sink)
{
   installLibbpfLog();
   const std::lock_guard lock(logMutex);
   logSink = std::move(sink);
}

Error::Error(const std::string &what, int error)
   : std::runtime_error(what + ": " + std::strerror(error)), error_(error)
{
}

uint64_t Counters::punted() const
{
   uint64_t sum = 0;
   for (uint32_t reason = SWSEC_FP_PUNT_NOT_READY; reason < SWSEC_FP_PUNT_LOST; ++reason) {
      sum += frames[reason];
   }
   return sum;
}

uint64_t Counters::dropped() const
{
   return frames[SWSEC_FP_DROP_IP_SOURCE_GUARD] + frames[SWSEC_FP_DROP_ARP_BUDGET] + frames[SWSEC_FP_DROP_ETHER_TYPE] +
          frames[SWSEC_FP_DROP_IPV6_SOURCE_GUARD] + frames[SWSEC_FP_DROP_ND_BUDGET];
}

std::string_view reasonName(uint32_t reason)
{
   return reason < SWSEC_FP_REASON_COUNT ? kReasonNames[reason] : "unknown";
}

std::string pinDirFor(std::string_view port)
{
   const bool control = std::any_of(port.begin(), port.end(), [](char c) { return static_cast<unsigned char>(c) < 0x20 || c == 0x7f; });
   if (port.empty() || port.size() > 64 || port == "." || port == ".." || port.find('/') != port.npos || control) {
      throw Error("no pin directory for the port name '" + std::string(port) + "'", EINVAL);
   }
   return "/sys/fs/bpf/swsec/" + std::string(port);
}

Untagged takeOuterTag(std::span<const uint8_t> frame)
{
   Untagged out;
   if (frame.size() >= 18) {
      const uint16_t tpid = static_cast<uint16_t>(frame[12] << 8 | frame[13]);
      if (tpid == 0x8100 || tpid == 0x88a8 || tpid == 0x9100) {
         out.vlan = static_cast<uint16_t>((frame[14] << 8 | frame[15]) & 0x0fff);
         out.bytes.assign(frame.begin(), frame.begin() + 12);
         out.bytes.insert(out.bytes.end(), frame.begin() + 16, frame.end());
         return out;
      }
   }
   out.bytes.assign(frame.begin(), frame.end());
   return out;
}

std::optional<std::string> unavailable()
{
   try {
      const Program probe(Program::Options{});
   } catch (const Error &error) {
      // EACCES is also the verifier's refusal of the program: for root that is a fault, not a missing privilege.
      const bool denied = error.error() == EPERM || (error.error() == EACCES && geteuid() != 0);
      if (denied || error.error() == ENOSYS || error.error() == EOPNOTSUPP) {
         return error.what();
      }
      throw;
   }
   return std::nullopt;
}

Program::Program(const Options &options) : pinDir_(options.pinDir)
{
   installLibbpfLog();
   const auto object = embeddedObject();
   auto openOptions = optionsOf<bpf_object_open_opts>();
   openOptions.object_name = "swsec_fastpath";
   object_ = bpf_object__open_mem(object.data(), object.size(), &openOptions);
   if (object_ == nullptr) {
      throw Error("cannot open the fast path program", errno);
   }
   try {
      if (!pinDir_.empty()) {
         makePinDir(pinDir_);
         for (const char *name : kPinnedMaps) {
            bpf_map *map = bpf_object__find_map_by_name(object_, name);
            const std::string path = pinDir_ + "/" + name;
            check(map != nullptr ? bpf_map__set_pin_path(map, path.c_str()) : -ENOENT, "cannot pin " + path);
            dropStalePin(map, path);
         }
      }
      check(bpf_object__load(object_), "cannot load the fast path program");
      sink_ = new std::function<void(Punt &&)>;
      ring_ = ring_buffer__new(mapFd("swsec_punts"), takePunt, sink_, nullptr);
      if (ring_ == nullptr) {
         throw Error("cannot read the punt ring", errno);
      }
   } catch (...) {
      close();
      throw;
   }
}

Program::~Program()
{
   close();
}

Program::Program(Program &&other) noexcept
   : object_(std::exchange(other.object_, nullptr)), ring_(std::exchange(other.ring_, nullptr)),
     sink_(std::exchange(other.sink_, nullptr)), pinDir_(std::move(other.pinDir_))
{
}

Program &Program::operator=(Program &&other) noexcept
{
   if (this != &other) {
      close();
      object_ = std::exchange(other.object_, nullptr);
      ring_ = std::exchange(other.ring_, nullptr);
      sink_ = std::exchange(other.sink_, nullptr);
      pinDir_ = std::move(other.pinDir_);
   }
   return *this;
}

void Program::close() noexcept
{
   if (ring_ != nullptr) {
      ring_buffer__free(ring_);
      ring_ = nullptr;
   }
   delete sink_;
   sink_ = nullptr;
   if (object_ != nullptr) {
      bpf_object__close(object_);
      object_ = nullptr;
   }
}

int Program::mapFd(const char *name) const
{
   const bpf_map *map = bpf_object__find_map_by_name(object_, name);
   return check(map != nullptr ? bpf_map__fd(map) : -ENOENT, std::string("no map ") + name);
}

int Program::programFd(uint32_t direction) const
{
   const char *name = direction == SWSEC_FP_DIR_FROM_VM ? "swsec_from_vm" : "swsec_to_vm";
   const bpf_program *program = bpf_object__find_program_by_name(object_, name);
   return check(program != nullptr ? bpf_program__fd(program) : -ENOENT, std::string("no program ") + name);
}

int Program::injectFd() const
{
   const bpf_program *program = bpf_object__find_program_by_name(object_, "swsec_inject");
   return check(program != nullptr ? bpf_program__fd(program) : -ENOENT, "no program swsec_inject");
}

int Program::puntFd() const
{
   return check(ring_buffer__epoll_fd(ring_), "no punt ring");
}

void Program::setVmInterface(uint32_t ifindex, bool ownQdisc)
{
   swsec_fp_port value = port();
   value.vm_ifindex = ifindex;
   value.flags = ownQdisc ? (value.flags | SWSEC_FP_PORT_OWN_QDISC) : (value.flags & ~SWSEC_FP_PORT_OWN_QDISC);
   const uint32_t zero = 0;
   check(bpf_map_update_elem(mapFd("swsec_port"), &zero, &value, BPF_ANY), "cannot write the port map");
}

swsec_fp_port Program::port() const
{
   const uint32_t zero = 0;
   swsec_fp_port value{};
   check(bpf_map_lookup_elem(mapFd("swsec_port"), &zero, &value), "cannot read the port map");
   return value;
}

void Program::describe(const PortDescription &description)
{
   if (description.etherTypes.size() > SWSEC_FP_MAX_ETHER_TYPES) {
      throw Error("a list of " + std::to_string(description.etherTypes.size()) + " ethertypes", E2BIG);
   }
   if (description.bindings.size() > SWSEC_FP_MAX_BINDINGS || description.bindings6.size() > SWSEC_FP_MAX_BINDINGS6) {
      throw Error("a port of " + std::to_string(description.bindings.size()) + " IPv4 and " +
                     std::to_string(description.bindings6.size()) + " IPv6 bindings (at most " +
                     std::to_string(SWSEC_FP_MAX_BINDINGS) + " and " + std::to_string(SWSEC_FP_MAX_BINDINGS6) + ")",
                  E2BIG);
   }
   // Not ready while the bindings change, so that no frame is judged on a half-filled map.
   setNotReady();
   const swsec_fp_port before = port();
   const int fd = mapFd("swsec_bindings");
   for (const Binding &binding : bindings()) {
      const swsec_fp_binding_key key = keyOf(binding);
      check(bpf_map_delete_elem(fd, &key), "cannot remove a binding");
   }
   for (const Binding &binding : description.bindings) {
      apply({.added = true, .binding = binding, .ipv6 = std::nullopt});
   }
   const int fd6 = mapFd("swsec_bindings6");
   for (const Binding6 &binding : bindings6()) {
      const swsec_fp_binding6_key key = keyOf(binding);
      check(bpf_map_delete_elem(fd6, &key), "cannot remove an IPv6 binding");
   }
   for (const Binding6 &binding : description.bindings6) {
      apply({.added = true, .binding = {}, .ipv6 = binding});
   }
   swsec_fp_port value{};
   value.features = description.features;
   value.port_id = description.portId;
   value.vm_ifindex = before.vm_ifindex;
   value.num_ether_types = static_cast<uint32_t>(description.etherTypes.size());
   std::copy(description.etherTypes.begin(), description.etherTypes.end(), value.ether_types);
   value.arp_punts = puntBudget(description.arpRateLimit);
   value.fhs_features = description.ipv6Features;
   value.nd_punts = description.ipv6Trusted ? 0 : puntBudget(description.ndRateLimit);
   value.flags = (before.flags & SWSEC_FP_PORT_OWN_QDISC) | SWSEC_FP_PORT_READY | (description.trusted ? SWSEC_FP_PORT_TRUSTED : 0u) |
                 (description.errorState ? SWSEC_FP_PORT_ERR_STATE : 0u) |
                 (description.ipv6Trusted ? SWSEC_FP_PORT_FHS_TRUSTED : 0u) |
                 (description.ndErrorState ? SWSEC_FP_PORT_ND_ERR_STATE : 0u);
   const uint32_t zero = 0;
   check(bpf_map_update_elem(mapFd("swsec_port"), &zero, &value, BPF_ANY), "cannot write the port map");
}

void Program::setNotReady()
{
   swsec_fp_port value = port();
   value.flags &= ~SWSEC_FP_PORT_READY;
   const uint32_t zero = 0;
   check(bpf_map_update_elem(mapFd("swsec_port"), &zero, &value, BPF_ANY), "cannot write the port map");
}

void Program::setErrorState(bool on, bool nd)
{
   swsec_fp_port value = port();
   const uint32_t flags = (value.flags & ~(SWSEC_FP_PORT_ERR_STATE | SWSEC_FP_PORT_ND_ERR_STATE)) |
                          (on ? SWSEC_FP_PORT_ERR_STATE : 0u) | (nd ? SWSEC_FP_PORT_ND_ERR_STATE : 0u);
   if (flags == value.flags) {
      return;
   }
   value.flags = flags;
   const uint32_t zero = 0;
   check(bpf_map_update_elem(mapFd("swsec_port"), &zero, &value, BPF_ANY), "cannot write the port map");
}

void Program::apply(const BindingChange &change)
{
   if (change.ipv6) {
      const swsec_fp_binding6_key key = keyOf(*change.ipv6);
      const int fd = mapFd("swsec_bindings6");
      if (change.added) {
         // refresh_ns 0: the VM's next frame from it is punted, then one in SWSEC_FP_FCFS_REFRESH_NS.
         swsec_fp_binding6 value{};
         value.fcfs = change.ipv6->fcfs ? 1 : 0;
         check(bpf_map_update_elem(fd, &key, &value, BPF_ANY), "cannot add an IPv6 binding");
         return;
      }
      const int result = bpf_map_delete_elem(fd, &key);
      if (result != -ENOENT) {
         check(result, "cannot remove an IPv6 binding");
      }
      return;
   }
   const swsec_fp_binding_key key = keyOf(change.binding);
   const int fd = mapFd("swsec_bindings");
   if (change.added) {
      swsec_fp_binding value{};
      value.authoritative = change.binding.authoritative ? 1 : 0;
      check(bpf_map_update_elem(fd, &key, &value, BPF_ANY), "cannot add a binding");
      return;
   }
   const int result = bpf_map_delete_elem(fd, &key);
   if (result != -ENOENT) {
      check(result, "cannot remove a binding");
   }
}

namespace {

// Calls `visit` with each key and value of a hash map holding at most
// `limit` keys (the bound keeps a walk finite while the map changes).
template <typename Key, typename Value, typename Visit>
void forEachEntry(int fd, int limit, Visit visit)
{
   Key key{};
   Key next{};
   const void *previous = nullptr;
   for (int guard = 0; guard <= limit && bpf_map_get_next_key(fd, previous, &next) == 0; ++guard) {
      Value value{};
      if (bpf_map_lookup_elem(fd, &next, &value) == 0) {
         visit(next, value);
      }
      key = next;
      previous = &key;
   }
}

}  // namespace

std::vector<Binding> Program::bindings() const
{
   std::vector<Binding> out;
   forEachEntry<swsec_fp_binding_key, swsec_fp_binding>(
      mapFd("swsec_bindings"), SWSEC_FP_MAX_BINDINGS, [&out](const auto &key, const auto &value) {
         Binding binding;
         binding.vlan = key.vlan;
         std::memcpy(binding.mac.data(), key.mac, sizeof key.mac);
         binding.ip = key.ip;
         binding.authoritative = value.authoritative != 0;
         out.push_back(binding);
      });
   return out;
}

std::vector<Binding6> Program::bindings6() const
{
   std::vector<Binding6> out;
   forEachEntry<swsec_fp_binding6_key, swsec_fp_binding6>(
      mapFd("swsec_bindings6"), SWSEC_FP_MAX_BINDINGS6, [&out](const auto &key, const auto &value) {
         Binding6 binding;
         binding.vlan = key.vlan;
         std::memcpy(binding.mac.data(), key.mac, sizeof key.mac);
         std::memcpy(binding.addr.data(), key.addr, sizeof key.addr);
         binding.fcfs = value.fcfs != 0;
         out.push_back(binding);
      });
   return out;
}

Counters Program::counters() const
{
   const int cpus = check(libbpf_num_possible_cpus(), "cannot count the CPUs");
   const int fd = mapFd("swsec_counters");
   Counters out;
   std::vector<uint64_t> perCpu(static_cast<size_t>(cpus));
   for (uint32_t reason = 0; reason < SWSEC_FP_REASON_COUNT; ++reason) {
      check(bpf_map_lookup_elem(fd, &reason, perCpu.data()), "cannot read the counters");
      for (uint64_t count : perCpu) {
         out.frames[reason] += count;
      }
   }
   return out;
}

Program::Run Program::testRun(std::span<const uint8_t> frame, uint32_t direction, uint32_t repeat) const
{
   auto options = optionsOf<bpf_test_run_opts>();
   options.data_in = frame.data();
   options.data_size_in = static_cast<uint32_t>(frame.size());
   options.repeat = static_cast<int>(repeat);
   check(bpf_prog_test_run_opts(programFd(direction), &options), "cannot run the fast path program");
   return Run{.action = static_cast<int>(options.retval), .nanoseconds = options.duration};
}

size_t Program::drainPunts(const std::function<void(Punt &&)> &sink)
{
   *sink_ = sink;
   const int consumed = ring_buffer__consume(ring_);
   *sink_ = nullptr;
   return static_cast<size_t>(check(consumed, "cannot read the punt ring"));
}

void Program::unpin()
{
   if (pinDir_.empty()) {
      return;
   }
   for (const char *name : kPinnedMaps) {
      bpf_map *map = bpf_object__find_map_by_name(object_, name);
      if (map != nullptr && bpf_map__is_pinned(map)) {
         check(bpf_map__unpin(map, nullptr), std::string("cannot unpin ") + name);
      }
   }
   std::error_code ignored;
   std::filesystem::remove(pinDir_, ignored);
}

Attachment::Attachment(const Program &program, int ifindex, bool ingress, bool egress)
   : Attachment(ifindex, Hooks{.ingressFd = ingress ? program.programFd(SWSEC_FP_DIR_FROM_VM) : -1,
                               .egressFd = egress ? program.programFd(SWSEC_FP_DIR_TO_VM) : -1})
{
}

Attachment::Attachment(int ifindex, const Hooks &hooks) : ifindex_(ifindex)
{
   installLibbpfLog();
   auto hook = optionsOf<bpf_tc_hook>();
   hook.ifindex = ifindex;
   hook.attach_point = BPF_TC_INGRESS;
   const int made = bpf_tc_hook_create(&hook);
   if (made != -EEXIST) {
      check(made, "cannot add a clsact qdisc to interface " + std::to_string(ifindex));
      madeQdisc_ = true;
   }
   try {
      const auto attach = [&](Hook &state, bpf_tc_attach_point point, int fd) {
         hook.attach_point = point;
         auto options = optionsOf<bpf_tc_opts>();
         options.prog_fd = fd;
         if (hooks.priority != 0) {
            options.handle = 1;
            options.priority = hooks.priority;
            options.flags = BPF_TC_F_REPLACE;
         }
         check(bpf_tc_attach(&hook, &options), "cannot attach to interface " + std::to_string(ifindex));
         state = Hook{.attached = true, .handle = options.handle, .priority = options.priority};
      };
      if (hooks.ingressFd >= 0) {
         attach(ingress_, BPF_TC_INGRESS, hooks.ingressFd);
      }
      if (hooks.egressFd >= 0) {
         attach(egress_, BPF_TC_EGRESS, hooks.egressFd);
      }
   } catch (...) {
      try {
         detach();
      } catch (const Error &) {
         // The attach error is the one to report.
      }
      throw;
   }
}

bool Attachment::removeLeftover(int ifindex, uint32_t priority)
{
   installLibbpfLog();
   bool found = false;
   for (const bpf_tc_attach_point point : {BPF_TC_INGRESS, BPF_TC_EGRESS}) {
      auto hook = optionsOf<bpf_tc_hook>();
      hook.ifindex = ifindex;
      hook.attach_point = point;
      auto options = optionsOf<bpf_tc_opts>();
      options.handle = 1;
      options.priority = priority;
      const int result = bpf_tc_detach(&hook, &options);
      if (result == 0) {
         found = true;
      } else if (result != -ENOENT && result != -EINVAL && result != -ENODEV) {
         check(result, "cannot remove a filter from interface " + std::to_string(ifindex));
      }
   }
   return found;
}

Attachment::~Attachment()
{
   try {
      detach();
   } catch (const Error &) {
      // An interface that went takes its hooks with it.
   }
}

void Attachment::detach()
{
   auto hook = optionsOf<bpf_tc_hook>();
   hook.ifindex = ifindex_;
   hook.attach_point = BPF_TC_INGRESS;
   int failed = 0;
   for (auto [state, point] : {std::pair{&ingress_, BPF_TC_INGRESS}, std::pair{&egress_, BPF_TC_EGRESS}}) {
      if (!state->attached) {
         continue;
      }
      hook.attach_point = point;
      auto options = optionsOf<bpf_tc_opts>();
      options.handle = state->handle;
      options.priority = state->priority;
      const int result = bpf_tc_detach(&hook, &options);
      if (result < 0 && result != -ENOENT && result != -ENODEV) {
         failed = result;
      }
      state->attached = false;
   }
   if (madeQdisc_) {
      madeQdisc_ = false;
      hook.attach_point = static_cast<bpf_tc_attach_point>(BPF_TC_INGRESS | BPF_TC_EGRESS);
      const int result = bpf_tc_hook_destroy(&hook);
      if (result < 0 && result != -ENOENT && result != -ENODEV && result != -EINVAL) {
         failed = result;
      }
   }
   check(failed, "cannot detach from interface " + std::to_string(ifindex_));
}

}  // namespace swsec::fastpath
