// The replay as JSON: one document, or one object a line (--json-lines).
// Frames are written as the ports judge them, so memory does not grow
// with the capture; the rest follows the last frame. Numbers are JSON
// numbers (counts, seconds); text stays text; "N/A" is null.
#pragma once

#include "replay/engine.h"

#include <nlohmann/json.hpp>

#include <ostream>

namespace swsec::replay {

nlohmann::json frameJson(const FrameVerdict &frame, std::string_view description, const std::string &port);
// Everything but the frames.
nlohmann::json summaryJson(const ReplayResult &result);
// The whole document from the frames a result kept.
nlohmann::json replayJson(const ReplayResult &result);

class JsonFrameStream {
public:
   enum class Form : uint8_t { document, lines };
   JsonFrameStream(std::ostream &out, Form form, std::vector<std::string> portNames);

   void frame(const FrameEvent &event);
   // The summary after the last frame.
   void finish(const ReplayResult &result);

private:
   std::ostream &out_;
   Form form_;
   std::vector<std::string> portNames_;
   bool first_ = true;
};

}  // namespace swsec::replay
