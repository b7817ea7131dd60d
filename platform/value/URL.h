#pragma once

// tn::URL: the file URLs by which requests name bundles ("file:///opt/x/A/").
// Keeps the scheme, host and the percent-decoded path; absoluteString()
// percent-encodes again.

#include <optional>
#include <string>
#include <string_view>

#include <fmt/format.h>

namespace tn {

class URL {
 public:
  // A file URL for an absolute or relative path, taken as given (a relative
  // path stays relative: "file:relative/p").
  static URL fileURLWithPath(std::string_view path);

  // Parses "scheme://host/path" (host may be empty) with percent-decoding of
  // the path. Returns none for a string without "scheme:", with a bad escape
  // ("%G1", a truncated "%4"), or with a NUL, escaped ("%00") or raw.
  static std::optional<URL> parse(std::string_view text);

  const std::string& scheme() const { return scheme_; }
  const std::string& host() const { return host_; }
  // The decoded path ("/opt/My App/").
  const std::string& path() const { return path_; }
  bool isFileURL() const { return scheme_ == "file"; }

  // "file:///opt/My%20App/": characters outside the unreserved set and "/"
  // are percent-encoded.
  std::string absoluteString() const;

  friend bool operator==(const URL&, const URL&) = default;

 private:
  std::string scheme_;
  std::string host_;
  std::string path_;
};

}  // namespace tn

template <>
struct fmt::formatter<tn::URL> : fmt::formatter<std::string_view> {
  auto format(const tn::URL& u, fmt::format_context& ctx) const {
    return fmt::formatter<std::string_view>::format(u.absoluteString(), ctx);
  }
};
