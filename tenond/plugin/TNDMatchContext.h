#pragma once

// TNDMatchContext: what matching a plug-in against rules needs from outside
// the plug-in record: the type hierarchy (for "?TY-" patterns and
// activation rules) and the user's annotations (for "XTUserElection").
//
// A request takes current() once and matches every candidate with it, so
// all candidates see one state of the type hierarchy. Tests and tools make
// their own, with a private type table and annotation reader.

#include <functional>
#include <memory>
#include <optional>

#include "platform/types/TypeTable.h"
#include "platform/value/Value.h"

namespace tnd {

class TNDPlugIn;

struct TNDMatchContext {
  // Reads the user's annotation of a plug-in (the database's
  // annotationForPlugIn). Must not be called on the database queue.
  using AnnotationSource = std::function<std::optional<tn::Dictionary>(const TNDPlugIn&)>;

  std::shared_ptr<const types::TypeTable> types;  // never null
  AnnotationSource annotationForPlugIn;           // empty: no plug-in has an annotation

  // The process's type hierarchy (types::TypeHierarchy::system()) as it is
  // now, and the process's annotation source.
  static TNDMatchContext current();

  // Sets the process's annotation source; the server sets its database's
  // at start-up. Any thread.
  static void setAnnotationSource(AnnotationSource source);
};

}  // namespace tnd
