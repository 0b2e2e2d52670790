#pragma once

#include <benchmark/benchmark.h>

#include <cstdio>
#include <map>
#include <string>
#include <vector>

// Benchmarks that stand side by side: name each one "row@variant". After the run a table shows, for
// every row, the time of each variant and the first one's ratio to it: below 1, the first is
// faster.
namespace Korvel::Bench {

constexpr double kNsPerSecond = 1e9;

class CompareReporter : public benchmark::ConsoleReporter {
public:
    // With repetitions the median counts, else the single run.
    void ReportRuns(const std::vector<Run>& runs) override {
        for (const Run& run : runs) {
            if (run.run_type == Run::RT_Aggregate ? run.aggregate_name != "median"
                                                  : run.repetitions > 1) {
                continue;
            }
            const std::string& name = run.run_name.function_name;
            size_t at = name.find('@');
            if (at == std::string::npos || run.error_occurred) continue;
            std::string row = name.substr(0, at);
            for (const std::string* part : {&run.run_name.args, &run.run_name.threads}) {
                if (!part->empty()) row.append("/").append(*part);
            }
            // With several threads the library divides by the sum of what they have done.
            Add(row, name.substr(at + 1),
                run.GetAdjustedRealTime() * kNsPerSecond /
                    benchmark::GetTimeUnitMultiplier(run.time_unit) *
                    static_cast<double>(run.threads));
        }
        ConsoleReporter::ReportRuns(runs);
    }

    void PrintTable() const {
        printf("\n%-44s", "ns an operation (ratio of the first)");
        for (const std::string& variant : m_Variants) printf(" %19s", variant.c_str());
        printf("\n");
        for (const std::string& row : m_Rows) {
            printf("%-44s", row.c_str());
            const auto& times = m_Times.at(row);
            auto own = times.find(m_Variants[0]);
            for (const std::string& variant : m_Variants) {
                auto found = times.find(variant);
                if (found == times.end()) {
                    printf(" %19s", "-");
                } else if (found == own || own == times.end()) {
                    printf(" %19.2f", found->second);
                } else {
                    printf(" %12.2f (%4.2f)", found->second, own->second / found->second);
                }
            }
            printf("\n");
        }
    }

private:
    void Add(const std::string& row, const std::string& variant, double time) {
        if (m_Times.find(row) == m_Times.end()) m_Rows.push_back(row);
        m_Times[row][variant] = time;
        for (const std::string& known : m_Variants) {
            if (known == variant) return;
        }
        m_Variants.push_back(variant);
    }

    std::vector<std::string> m_Rows;
    std::vector<std::string> m_Variants;
    std::map<std::string, std::map<std::string, double>> m_Times;
};

// The body of a comparing benchmark's main.
inline int RunComparison(int argc, char** argv) {
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
    CompareReporter reporter;
    if (benchmark::RunSpecifiedBenchmarks(&reporter) == 0) return 1;
    reporter.PrintTable();
    benchmark::Shutdown();
    return 0;
}

}  // namespace Korvel::Bench
