#pragma once

// Internal to the document writers: where in a value the writer is, so that
// an error can say which part could not be written ('["data"]["x"][3]').

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

#include <fmt/format.h>

#include "platform/value/DocumentInput.h"

namespace tn::document {

class ValuePath {
 public:
  // The key must outlive its step (it lives in the value being written).
  void pushKey(std::string_view key) { steps_.push_back({key, 0}); }
  void pushIndex(size_t index) { steps_.push_back({{}, index + 1}); }
  void pop() { steps_.pop_back(); }

  // '["data"][3]', or "the top level" for the root.
  std::string text() const {
    if (steps_.empty()) return "the top level";
    std::string out;
    for (const Step& step : steps_)
      out += step.indexPlusOne ? fmt::format("[{}]", step.indexPlusOne - 1)
                               : fmt::format("[{}]", quotedForMessage(step.key));
    return out;
  }

 private:
  struct Step {
    std::string_view key;
    size_t indexPlusOne;  // 0 for a key
  };
  std::vector<Step> steps_;
};

}  // namespace tn::document
