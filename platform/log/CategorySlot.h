// CategorySlot: the process-wide log object of one category, made on first
// use and kept until exit.
//
// The first get() asks the slot's maker for the log object of the category.
// If the maker yields none, "unable to create tracelog for category <name>"
// is logged at error level on the default log, and the default log serves as
// this category's log object from then on. Concurrent first calls make the
// object once; every call returns the same object.

#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

#include "platform/log/LogObject.h"

namespace tn::log {

class CategorySlot {
 public:
  // Makes the log object of a category (the name is NUL-terminated), or
  // returns null when it cannot.
  using Maker = std::function<std::shared_ptr<Log>(const char* category)>;

  CategorySlot(std::string name, Maker maker);
  CategorySlot(const CategorySlot&) = delete;
  CategorySlot& operator=(const CategorySlot&) = delete;

  const std::string& name() const { return name_; }

  // Returns the category's log object, making it on the first call (see
  // above). Thread-safe; the maker runs at most once per slot. The object
  // lives as long as the slot.
  Log& get();

 private:
  void make();

  std::string name_;
  Maker maker_;
  std::once_flag once_;
  std::shared_ptr<Log> owned_;    // what the maker made, if anything
  std::atomic<Log*> log_{nullptr};  // owned_ or the default log, once made
};

}  // namespace tn::log
