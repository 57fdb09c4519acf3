// The lines scripts/bench gathers from every benchmark into one table: a
// figure of berthd beside the figure of its baseline measured in the same run
// (an echo server, du, rm -rf, another berthd build, ...). Each benchmark
// prints its own detailed rows as well; these lines only repeat the headline.
#pragma once

#include <string>

namespace berth::bench {

// Prints "summary|<bench>|<workload>|<unit>|<measured>|<baseline name>|<baseline>".
// A baseline of 0 (none measured) shows as "-" in the table.
void printSummary(const std::string& bench, const std::string& workload, const std::string& unit,
                  double measured, const std::string& baselineName, double baseline);

}  // namespace berth::bench
