// What a replay shows: the readable report and the JSON document.
#pragma once

#include "replay_engine.h"

#include <nlohmann/json.hpp>

#include <ostream>

namespace swsec::replay {

nlohmann::json replayJson(const ReplayResult &result);

// `verbose` adds one line per dropped frame.
void printReplayReport(std::ostream &out, const ReplayResult &result, bool verbose);

const char *directionName(uint8_t direction);

}  // namespace swsec::replay
