// Helpers of `sitedeck status` that are worth testing on their own.
#pragma once

#include <string>

// "3 h 12 min ago" for an age of 11520 seconds: seconds below a minute,
// minutes below an hour, hours and minutes below a day, else days and hours.
std::string sds_tool_format_age(long long seconds);
