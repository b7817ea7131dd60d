#pragma once

// The scale benchmark's table: each figure with its target and PASS or
// MISS, printed once every figure is in.

#include <cstdio>
#include <string>
#include <vector>

namespace tn::bench {

class Report {
 public:
  void add(std::string measure, std::string figure, std::string target, bool passed) {
    rows_.push_back({std::move(measure), std::move(figure), std::move(target), passed ? "PASS" : "MISS"});
  }
  // A figure shown for what it tells, with no target of its own.
  void show(std::string measure, std::string figure) {
    rows_.push_back({std::move(measure), std::move(figure), "", "shown"});
  }

  // Prints the table to stdout; returns how many figures missed their
  // target.
  int print() const {
    int missed = 0;
    std::printf("\n%-48s  %-44s  %-12s  %s\n", "measure", "figure", "target", "result");
    for (const Row& row : rows_) {
      std::printf("%-48s  %-44s  %-12s  %s\n", row.measure.c_str(), row.figure.c_str(), row.target.c_str(),
                  row.result.c_str());
      if (row.result == "MISS") ++missed;
    }
    return missed;
  }

 private:
  struct Row {
    std::string measure;
    std::string figure;
    std::string target;
    std::string result;  // PASS, MISS or shown
  };
  std::vector<Row> rows_;
};

// printf into a string.
template <typename... Arguments>
std::string format(const char* pattern, Arguments... arguments) {
  char text[256];
  std::snprintf(text, sizeof text, pattern, arguments...);
  return text;
}

}  // namespace tn::bench
