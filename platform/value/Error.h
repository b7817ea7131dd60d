#pragma once

// tn::Error: the error value of the system: a domain, a signed code and an
// optional message. Errors made by the daemon and its client library have the
// domain "Tenon" and are made with TNMakeError / TNMakeErrorWithFormat.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include <fmt/format.h>

namespace tn {

inline constexpr std::string_view kTenonErrorDomain = "Tenon";

class Error {
 public:
  Error() = default;
  Error(std::string domain, int64_t code, std::optional<std::string> message = std::nullopt)
      : domain_(std::move(domain)), code_(code), message_(std::move(message)) {}

  const std::string& domain() const { return domain_; }
  int64_t code() const { return code_; }

  // The message the error was made with, if any (its "user information").
  const std::optional<std::string>& message() const { return message_; }

  // The message when there is one, otherwise a generic text naming the
  // domain and code ("The operation could not be completed (Tenon error 9)").
  std::string localizedDescription() const;

  // "Tenon 9: no plugin at /x" style, for logs.
  std::string description() const;

  friend bool operator==(const Error&, const Error&) = default;

 private:
  std::string domain_;
  int64_t code_ = 0;
  std::optional<std::string> message_;
};

// An error of domain "Tenon" with the code, and the message when present.
Error TNMakeError(int64_t code, std::optional<std::string> message = std::nullopt);

// An error of domain "Tenon" whose message is the format applied to the
// arguments ("unable to enable plug-in {}({})").
template <typename... Args>
Error TNMakeErrorWithFormat(int64_t code, fmt::format_string<Args...> format, Args&&... args) {
  return TNMakeError(code, fmt::format(format, std::forward<Args>(args)...));
}

// Without a format there is no message.
inline Error TNMakeErrorWithFormat(int64_t code, std::nullopt_t) { return TNMakeError(code); }

}  // namespace tn

template <>
struct fmt::formatter<tn::Error> : fmt::formatter<std::string_view> {
  auto format(const tn::Error& e, fmt::format_context& ctx) const {
    return fmt::formatter<std::string_view>::format(e.description(), ctx);
  }
};
