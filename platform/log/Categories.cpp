#include "platform/log/Categories.h"

#include "platform/log/CategorySlot.h"
#include "platform/log/Names.h"

namespace tn::log {

namespace {

// Slots are never destroyed (see Categories.h).
CategorySlot* newSlot(const char* name) { return new CategorySlot(name, makeCategoryLog); }

}  // namespace

std::shared_ptr<Log> makeCategoryLog(const char* category) {
  return createLog(kSubsystem, category);
}

Log& ops() {
  static CategorySlot* slot = newSlot("ops");
  return slot->get();
}

Log& traffic() {
  static CategorySlot* slot = newSlot("traffic");
  return slot->get();
}

Log& extension() {
  static CategorySlot* slot = newSlot("extension");
  return slot->get();
}

Log& rg() {
  static CategorySlot* slot = newSlot("rg");
  return slot->get();
}

Log& sandbox() {
  static CategorySlot* slot = newSlot("sandbox");
  return slot->get();
}

}  // namespace tn::log
