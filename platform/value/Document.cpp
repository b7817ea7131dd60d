// The entry points of Document.h: the size limit, the byte order mark, the
// choice of reader, and reading a file.

#include "platform/value/Document.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include <fmt/format.h>

#include "platform/value/DocumentReaders.h"

namespace tn {
namespace {

constexpr std::string_view kByteOrderMark = "\xEF\xBB\xBF";

std::string_view withoutByteOrderMark(std::string_view bytes) {
  if (bytes.starts_with(kByteOrderMark)) bytes.remove_prefix(kByteOrderMark.size());
  return bytes;
}

Error tooLarge(std::string_view name, uint64_t size) {
  return document::documentError(
      DocumentErrorCode::TooLarge,
      fmt::format("{}: too large: {} bytes (the limit is {})", name, size, kMaxDocumentSize));
}

Error unreadable(std::string_view path, int error) {
  return document::documentError(DocumentErrorCode::Unreadable,
                                 fmt::format("{}: cannot read: {}", path, std::strerror(error)));
}

// Reads all of fd, refusing more than kMaxDocumentSize bytes (checked
// against the size the file reports first, then against what it delivers,
// since files in /proc and pipes report no size).
Result<std::string> readAll(int fd, const std::string& path) {
  struct stat status {};
  if (::fstat(fd, &status) != 0) return unreadable(path, errno);
  if (S_ISREG(status.st_mode) && static_cast<uint64_t>(status.st_size) > kMaxDocumentSize)
    return tooLarge(path, static_cast<uint64_t>(status.st_size));
  std::string bytes;
  bytes.reserve(S_ISREG(status.st_mode) ? static_cast<size_t>(status.st_size) : 0);
  char buffer[65536];
  for (;;) {
    const ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return unreadable(path, errno);
    if (n == 0) return bytes;
    bytes.append(buffer, static_cast<size_t>(n));
    if (bytes.size() > kMaxDocumentSize) return tooLarge(path, bytes.size());
  }
}

}  // namespace

bool isDocumentError(const Error& error, DocumentErrorCode code) {
  return error.domain() == kDocumentErrorDomain && error.code() == static_cast<int64_t>(code);
}

DocumentEncoding detectDocumentEncoding(std::string_view bytes) {
  bytes = withoutByteOrderMark(bytes);
  for (char c : bytes) {
    if (document::isDocumentWhitespace(c)) continue;
    return c == '<' ? DocumentEncoding::Xml : DocumentEncoding::Json;
  }
  return DocumentEncoding::Json;
}

Result<Value> readDocument(std::string_view bytes, std::string_view name) {
  return readDocument(bytes, name, detectDocumentEncoding(bytes));
}

Result<Value> readDocument(std::string_view bytes, std::string_view name, DocumentEncoding encoding) {
  if (bytes.size() > kMaxDocumentSize) return tooLarge(name, bytes.size());
  // The mark carries no line break, so line numbers stay right without it.
  const document::DocumentInput input(withoutByteOrderMark(bytes), name);
  return encoding == DocumentEncoding::Xml ? document::readXmlDocument(input) : document::readJsonDocument(input);
}

Result<Value> readDocumentFile(const std::string& path) {
  // Non-blocking, and only regular files: a FIFO or a device planted where a
  // manifest should be must not hang the reader.
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
  if (fd < 0) return unreadable(path, errno);
  struct stat status {};
  if (::fstat(fd, &status) != 0 || !S_ISREG(status.st_mode)) {
    const int error = errno;
    ::close(fd);
    if (S_ISDIR(status.st_mode)) return unreadable(path, EISDIR);
    if (!S_ISREG(status.st_mode) && status.st_mode != 0)
      return document::documentError(DocumentErrorCode::Unreadable, fmt::format("{}: not a regular file", path));
    return unreadable(path, error);
  }
  Result<std::string> bytes = readAll(fd, path);
  ::close(fd);
  if (!bytes) return bytes.error();
  return readDocument(*bytes, path);
}

}  // namespace tn
