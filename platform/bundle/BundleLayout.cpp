#include "platform/bundle/BundleLayout.h"

namespace bundle {

bool isPlainFileName(std::string_view name) {
  constexpr size_t kNameMax = 255;
  if (name.empty() || name.size() > kNameMax) return false;
  if (name == "." || name == "..") return false;
  return name.find('/') == std::string_view::npos && name.find('\0') == std::string_view::npos;
}

}  // namespace bundle
