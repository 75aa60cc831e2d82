// What a replay shows people: a report per port, then the module's log.
#pragma once

#include "replay/engine.h"

#include <ostream>

namespace swsec::replay {

// The -v line of a dropped frame, printed as the port drops it. The port
// is named when the run has several.
void printDroppedFrame(std::ostream &out, const FrameEvent &event, const std::string *port);

void printReplayReport(std::ostream &out, const ReplayResult &result);

const char *directionName(uint8_t direction);

// 99967 as "99,967".
std::string groupedCount(uint64_t count);

}  // namespace swsec::replay
