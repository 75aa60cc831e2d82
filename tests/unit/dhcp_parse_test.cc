// Recognising DHCP messages: what is refused (each with its message), what
// is found, and how the bytes are reached when the frame is in pieces.
#include "unit/hand_made_port.h"

#include "swsec/swsec_dhcp_parse.h"

#include <cstdio>
#include <functional>
#include <string>

namespace swsec::testing {
namespace {

const Mac kClientMac = Mac::parse("02:00:00:00:00:01");
constexpr uint32_t kDhcpOffset = 42;   // Ethernet 14 + IPv4 20 + UDP 8

Dhcp request()
{
   return Dhcp{.xid = 0x11223344, .chaddr = kClientMac, .type = kDhcpRequest};
}

Bytes frameOf(const Dhcp &dhcp)
{
   return dhcpFrame({.src = kClientMac, .dhcp = dhcp});
}

// Writes another UDP length into a frame.
Bytes withUdpLength(Bytes bytes, uint16_t length)
{
   bytes[38] = static_cast<uint8_t>(length >> 8);
   bytes[39] = static_cast<uint8_t>(length);
   return bytes;
}

std::string nullPointerText()
{
   char text[32];
   std::snprintf(text, sizeof(text), "%p", static_cast<void *>(nullptr));
   return text;
}

std::string cookieText(std::array<uint8_t, 4> cookie)
{
   uint32_t value = 0;
   std::memcpy(&value, cookie.data(), 4);
   char text[32];
   std::snprintf(text, sizeof(text), "0x%08x", value);
   return text;
}

class DhcpParseTest : public HandMadePortTest {
protected:
   // Parses the frame: 0 or -1.
   int parse(WrappedFrame &frame) { return SwSecDhcpParse(&ctx_, frame.pkt, &frame.info); }

   std::vector<std::string> errors()
   {
      std::vector<std::string> out;
      for (const auto &record : host().log().records()) {
         if (record.severity == ORR_LOG_ERROR) {
            out.push_back(record.text);
         }
      }
      return out;
   }
};

struct RefusalCase {
   const char *name;
   Bytes bytes;
   std::string message;   // after "port-7: ", without the newline
};

class DhcpParseRefusalTest : public DhcpParseTest, public ::testing::WithParamInterface<RefusalCase> {};

TEST_P(DhcpParseRefusalTest, malformed_messages_are_refused_with_their_message)
{
   const RefusalCase &c = GetParam();
   auto frame = wrap(c.bytes);
   EXPECT_EQ(parse(*frame), -1);
   const auto logged = errors();
   ASSERT_EQ(logged.size(), 1u) << ::testing::PrintToString(logTexts());
   EXPECT_NE(logged[0].find("port-7: " + c.message + "\n"), std::string::npos) << logged[0];
   EXPECT_EQ(frame->info.pktCopy, nullptr);
}

// The request with one change.
Dhcp requestWith(const std::function<void(Dhcp &)> &change)
{
   Dhcp dhcp = request();
   change(dhcp);
   return dhcp;
}

Dhcp ackWithout51()
{
   return requestWith([](Dhcp &d) { d.op = 2; d.type = kDhcpAck; });
}

// Options that run to the frame's end, the last one cut short: its length
// byte says more than the frame holds, or the frame ends with its code.
Bytes optionCutShort(Bytes tail)
{
   Bytes bytes = frameOf(requestWith([](Dhcp &d) { d.end = false; }));
   bytes.insert(bytes.end(), tail.begin(), tail.end());
   return withUdpLength(bytes, static_cast<uint16_t>(bytes.size() - 34));
}

const std::string kNil = nullPointerText();
const uint32_t kBareEnd = kDhcpOffset + 240;
const Dhcp kBare = requestWith([](Dhcp &d) { d.type.reset(); d.end = false; });

INSTANTIATE_TEST_SUITE_P(
   Messages, DhcpParseRefusalTest,
   ::testing::Values(
      RefusalCase{"udp_length_247", withUdpLength(frameOf(kBare), 247), "Invalid frame len"},
      RefusalCase{"udp_length_past_frame", withUdpLength(frameOf(request()), 300), "Invalid frame len"},
      RefusalCase{"udp_length_248_without_options", frameOf(kBare), "Invalid options: 0 " + kNil},
      RefusalCase{"end_option_without_type", frameOf(requestWith([](Dhcp &d) { d.type.reset(); })),
                  "Invalid options: 1 " + kNil},
      RefusalCase{"type_of_length_zero_is_no_type",
                  frameOf(requestWith([](Dhcp &d) { d.type.reset(); d.options = {{53, {}}}; })),
                  "Invalid options: 1 " + kNil},
      RefusalCase{"ack_without_lease_time", frameOf(ackWithout51()), "No lease time option in DHCPACK"},
      RefusalCase{"ack_with_three_byte_lease_time",
                  frameOf([] { Dhcp d = ackWithout51(); d.options = {{51, {0, 0, 0x0e}}}; return d; }()),
                  "No lease time option in DHCPACK"},
      RefusalCase{"htype_ieee802", frameOf(requestWith([](Dhcp &d) { d.htype = 6; })), "Invalid htype/hlen: [6 6]"},
      RefusalCase{"hlen_16", frameOf(requestWith([](Dhcp &d) { d.hlen = 16; })), "Invalid htype/hlen: [1 16]"},
      RefusalCase{"bad_cookie", frameOf(requestWith([](Dhcp &d) { d.cookie = {1, 2, 3, 4}; })),
                  "Invalid cookie: " + cookieText({1, 2, 3, 4})},
      RefusalCase{"option_value_past_frame", optionCutShort({12, 9, 'v'}),
                  "Can't access DHCP option: " + std::to_string(kBareEnd + 5)},
      RefusalCase{"option_length_past_frame", optionCutShort({12}),
                  "Can't access DHCP option len: " + std::to_string(kBareEnd + 4)}),
   [](const auto &test) { return std::string(test.param.name); });

TEST_F(DhcpParseTest, options_without_an_end_option_are_refused_with_the_type_found)
{
   auto frame = wrap(frameOf(requestWith([](Dhcp &d) { d.end = false; d.options = {{12, {'v', 'm'}}}; })));
   EXPECT_EQ(parse(*frame), -1);
   const auto logged = errors();
   ASSERT_EQ(logged.size(), 1u);
   char expected[64];
   std::snprintf(expected, sizeof(expected), "port-7: Invalid options: 0 %p\n",
                 static_cast<void *>(frame->info.frame + kBareEnd + 2));
   EXPECT_NE(logged[0].find(expected), std::string::npos) << logged[0];
}

TEST_F(DhcpParseTest, pads_and_empty_unknown_options_are_skipped_up_to_the_frames_end)
{
   Dhcp dhcp = request();
   dhcp.type.reset();
   dhcp.options = {{0, {}}, {200, {}}, {53, {kDhcpDecline}}};
   // The UDP length counts no options: the frame's length bounds the walk.
   auto frame = wrap(withUdpLength(frameOf(dhcp), 248));
   ASSERT_EQ(parse(*frame), 0) << ::testing::PrintToString(logTexts());
   EXPECT_EQ(frame->info.dhcpHdr, frame->info.frame + kDhcpOffset);
   ASSERT_NE(frame->info.dhcpMsgType, nullptr);
   EXPECT_EQ(*frame->info.dhcpMsgType, kDhcpDecline);
   EXPECT_EQ(frame->info.dhcpMsgType, frame->info.frame + kBareEnd + 5);
   EXPECT_EQ(frame->info.dhcpLeaseTime, nullptr);
   EXPECT_TRUE(errors().empty());
}

TEST_F(DhcpParseTest, options_are_found_and_the_last_occurrence_wins)
{
   Dhcp dhcp = ackWithout51();
   dhcp.clientId = Bytes{1, 2, 3};
   dhcp.leaseTime = 3600;
   dhcp.options = {{53, {kDhcpNak}}, {61, {9, 9, 9, 9}}};
   auto frame = wrap(frameOf(dhcp));
   ASSERT_EQ(parse(*frame), 0) << ::testing::PrintToString(logTexts());
   EXPECT_EQ(*frame->info.dhcpMsgType, kDhcpNak);
   EXPECT_EQ(frame->info.dhcpClientIdLen, 4u);
   EXPECT_EQ(Bytes(frame->info.dhcpClientId, frame->info.dhcpClientId + 4), (Bytes{9, 9, 9, 9}));
   EXPECT_EQ(Bytes(frame->info.dhcpLeaseTime, frame->info.dhcpLeaseTime + 4),
             (Bytes{0, 0, 0x0e, 0x10}));
}

TEST_F(DhcpParseTest, a_new_parse_clears_what_the_last_one_found)
{
   Dhcp dhcp = ackWithout51();
   dhcp.clientId = Bytes{1};
   dhcp.leaseTime = 60;
   auto frame = wrap(frameOf(dhcp));
   ASSERT_EQ(parse(*frame), 0);
   auto other = wrap(frameOf(request()));
   other->info.dhcpClientIdLen = frame->info.dhcpClientIdLen;
   other->info.dhcpClientId = frame->info.dhcpClientId;
   other->info.dhcpLeaseTime = frame->info.dhcpLeaseTime;
   ASSERT_EQ(parse(*other), 0);
   EXPECT_EQ(other->info.dhcpClientIdLen, 0u);
   EXPECT_EQ(other->info.dhcpClientId, nullptr);
   EXPECT_EQ(other->info.dhcpLeaseTime, nullptr);
}

TEST_F(DhcpParseTest, header_straddling_two_elements_is_parsed_from_one_copy)
{
   Dhcp dhcp = ackWithout51();
   dhcp.leaseTime = 600;
   const Bytes bytes = frameOf(dhcp);
   // Mapped and first element end 100 bytes into the DHCP header.
   auto frame = wrap(bytes, 0, {kDhcpOffset + 100}, kDhcpOffset + 100);
   ASSERT_EQ(parse(*frame), 0) << ::testing::PrintToString(logTexts());

   const uint8_t *copy = frame->info.pktCopy;
   ASSERT_NE(copy, nullptr);
   EXPECT_EQ(Bytes(copy, copy + bytes.size()), bytes);
   EXPECT_EQ(frame->info.dhcpHdr, copy + kDhcpOffset);
   EXPECT_EQ(frame->info.dhcpMsgType, copy + kBareEnd + 2);
   EXPECT_EQ(frame->info.dhcpLeaseTime, copy + kBareEnd + 5);
   EXPECT_EQ(host().faults().calls("orr_PktCopyBytesOut"), 1u);
}

TEST_F(DhcpParseTest, header_inside_one_unmapped_element_is_read_in_place)
{
   const Bytes bytes = frameOf(request());
   auto frame = wrap(bytes, 0, {kDhcpOffset, 240}, kDhcpOffset);
   ASSERT_EQ(parse(*frame), 0) << ::testing::PrintToString(logTexts());
   ASSERT_NE(frame->info.dhcpHdr, nullptr);
   EXPECT_EQ(Bytes(frame->info.dhcpHdr, frame->info.dhcpHdr + 240),
             Bytes(bytes.begin() + kDhcpOffset, bytes.begin() + kDhcpOffset + 240));
   // The options lie in the third element, also whole.
   EXPECT_EQ(frame->info.pktCopy, nullptr);
   EXPECT_EQ(*frame->info.dhcpMsgType, kDhcpRequest);
}

// A failed copy, or no memory for one, is reported with what needed it and leaves no copy.
TEST_F(DhcpParseTest, failed_copies_are_reported_with_what_needed_them_and_leave_no_copy)
{
   Dhcp withId = request();
   withId.clientId = Bytes{1, 2, 3};   // the header mapped, the identifier's value across the elements
   const struct {
      Dhcp dhcp;
      uint32_t split;   // the mapped length and the first element's end
      const char *op;
      orr_Status status;
      std::string copy;
      std::string access;
   } cases[] = {
      {request(), kDhcpOffset + 100, "orr_PktCopyBytesOut", ORR_FAILURE, "Failed to copy pkt: Failure(",
       "port-7: Can't access DHCP hdr\n"},
      {withId, kBareEnd + 6, "orr_HeapAllocWithRA", ORR_NO_MEMORY, "Failed to alloc pktCopy: ",
       "port-7: Can't access DHCP option: " + std::to_string(kBareEnd + 5)},
   };
   for (const auto &c : cases) {
      SCOPED_TRACE(c.op);
      host().log().clear();
      auto frame = wrap(frameOf(c.dhcp), 0, {c.split}, c.split);
      host().faults().failOnce(c.op, c.status);
      EXPECT_EQ(parse(*frame), -1);
      const auto logged = errors();
      ASSERT_EQ(logged.size(), 2u) << ::testing::PrintToString(logTexts());
      EXPECT_NE(logged[0].find(c.copy + std::to_string(frame->info.frameLen)), std::string::npos) << logged[0];
      EXPECT_NE(logged[1].find(c.access), std::string::npos) << logged[1];
      EXPECT_EQ(frame->info.pktCopy, nullptr);
   }
}

TEST_F(DhcpParseTest, mapped_access_refuses_ranges_beyond_the_frame_and_keeps_the_offset)
{
   auto frame = wrap(frameOf(request()));
   const uint32_t frameLen = frame->info.frameLen;
   struct Range {
      uint32_t offset;
      uint32_t length;
      bool inside;
   };
   for (const Range r : {Range{0, frameLen, true}, Range{frameLen - 1, 1, true},
                         Range{frameLen - 1, 2, false}, Range{frameLen, 1, false},
                         Range{0xffffffffu, 2, false}, Range{1, 0xffffffffu, false}}) {
      uint32_t offset = r.offset;
      uint8_t *ptr = SwSecGetMappedPtr(frame->pkt, &offset, r.length, &frame->info);
      EXPECT_EQ(ptr != nullptr, r.inside) << r.offset << "+" << r.length;
      EXPECT_EQ(offset, r.inside ? r.offset + r.length : r.offset);
   }
   EXPECT_EQ(frame->info.pktCopy, nullptr);
}

}  // namespace
}  // namespace swsec::testing
