// How `swsec ctl` shows the daemon's replies: text for a person, and the
// Prometheus text format for the counters.
#pragma once

#include <nlohmann/json.hpp>

#include <string>

namespace swsec::ctl {

// The reply's result of `command` as lines for a person.
std::string humanText(const std::string &command, const nlohmann::json &result);
// One streamed event (a notification of "watch", a line of "log") as one line.
std::string eventText(const std::string &command, const nlohmann::json &event);
// The "counters" result in the Prometheus text exposition format.
std::string metricsText(const nlohmann::json &counters);

}  // namespace swsec::ctl
