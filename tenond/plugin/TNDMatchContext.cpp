#include "tenond/plugin/TNDMatchContext.h"

#include <mutex>
#include <utility>

#include "platform/types/TypeHierarchy.h"

namespace tnd {
namespace {

std::mutex sourceMutex;
TNDMatchContext::AnnotationSource processSource;  // guarded by sourceMutex

}  // namespace

TNDMatchContext TNDMatchContext::current() {
  TNDMatchContext context;
  context.types = types::TypeHierarchy::system().snapshot();
  const std::lock_guard lock(sourceMutex);
  context.annotationForPlugIn = processSource;
  return context;
}

void TNDMatchContext::setAnnotationSource(AnnotationSource source) {
  const std::lock_guard lock(sourceMutex);
  processSource = std::move(source);
}

}  // namespace tnd
