// JSON shapes of the replay. Values the nodes render as text are turned
// into numbers where they are numbers ("118 sec" is 118), null where they
// do not apply.
#include "replay/json.h"

#include "replay/capture.h"
#include "replay/report.h"
#include "session/serializer.h"
#include "session/json_text.h"

#include <charconv>

namespace swsec::replay {

namespace {

using nlohmann::json;

json totalsJson(const PortResult &port)
{
   return {{"to-vm", {{"passed", port.totals[kDirToVm][0]}, {"dropped", port.totals[kDirToVm][1]}}},
           {"from-vm", {{"passed", port.totals[kDirFromVm][0]}, {"dropped", port.totals[kDirFromVm][1]}}}};
}

json portJson(const PortResult &port)
{
   json doc;
   doc["name"] = port.name;
   doc["macs"] = port.macs;
   doc["totals"] = totalsJson(port);
   json portDb = json::array();
   for (const auto &e : port.portDb) {
      portDb.push_back(session::bindingJson(e));
   }
   doc["portDb"] = std::move(portDb);
   doc["counters"] = session::countersJson(port.counters);
   doc["featureSummary"] = session::featureSummaryJson(port);
   doc["ipv6"] = session::ipv6Json(port);
   json notes = json::array();
   for (const auto &n : port.notifications) {
      json note = session::notificationJson(n);
      note["afterFrame"] = n.afterFrame;
      notes.push_back(std::move(note));
   }
   doc["notifications"] = std::move(notes);
   return doc;
}

}  // namespace

json frameJson(const FrameVerdict &frame, std::string_view description, const std::string &port)
{
   json entry = {{"index", frame.index},
                 {"time", frame.seconds()},
                 {"port", port},
                 {"direction", directionName(frame.direction)},
                 {"vlan", frame.vlan},
                 {"verdict", frame.passed ? "passed" : "dropped"}};
   if (frame.reason != DropReason::none) {
      entry["reason"] = dropReasonName(frame.reason);
   }
   if (!description.empty()) {
      entry["description"] = description;
   }
   return entry;
}

json summaryJson(const ReplayResult &result)
{
   json doc;
   json ports = json::array();
   for (const auto &port : result.ports) {
      ports.push_back(portJson(port));
   }
   doc["ports"] = std::move(ports);
   doc["framesRead"] = result.framesRead;
   doc["otherVlan"] = result.otherVlan;
   doc["unassigned"] = result.unassigned;
   json log = json::array();
   for (const auto &line : result.log) {
      log.push_back({{"severity", line.severity}, {"text", line.text}, {"repeated", line.repeated}});
   }
   doc["log"] = std::move(log);
   doc["violations"] = result.violations;
   doc["warnings"] = result.warnings;
   doc["warningsNotShown"] = result.warningsNotShown;
   return doc;
}

json replayJson(const ReplayResult &result)
{
   json doc = summaryJson(result);
   json frames = json::array();
   for (const auto &frame : result.frames) {
      frames.push_back(frameJson(frame, result.description(frame), result.ports.at(frame.port).name));
   }
   doc["frames"] = std::move(frames);
   return doc;
}

JsonFrameStream::JsonFrameStream(std::ostream &out, Form form, std::vector<std::string> portNames)
   : out_(out), form_(form), portNames_(std::move(portNames))
{
}

void JsonFrameStream::frame(const FrameEvent &event)
{
   json entry = frameJson(event.verdict, event.description, portNames_.at(event.verdict.port));
   if (form_ == Form::lines) {
      entry["type"] = "frame";
      out_ << session::jsonText(entry) << "\n";
      return;
   }
   // The document opens with its first frame, so that a run refused before
   // any frame writes nothing.
   out_ << (first_ ? "{\"frames\": [\n " : ",\n ") << session::jsonText(entry);
   first_ = false;
}

void JsonFrameStream::finish(const ReplayResult &result)
{
   json summary = summaryJson(result);
   if (form_ == Form::lines) {
      summary["type"] = "summary";
      out_ << session::jsonText(summary) << "\n";
      return;
   }
   // The summary's members follow the frames inside the one object.
   const std::string rest = session::jsonText(summary, 1);
   out_ << (first_ ? "{\"frames\": [],\n" : "\n],\n") << std::string_view(rest).substr(1) << "\n";
}

}  // namespace swsec::replay
