#include "BenchSummary.h"

#include <cstdio>

namespace berth::bench {

void printSummary(const std::string& bench, const std::string& workload, const std::string& unit,
                  double measured, const std::string& baselineName, double baseline) {
    std::printf("summary|%s|%s|%s|%.6g|%s|%.6g\n", bench.c_str(), workload.c_str(), unit.c_str(),
                measured, baselineName.c_str(), baseline);
    std::fflush(stdout);
}

}  // namespace berth::bench
