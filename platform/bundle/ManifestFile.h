#pragma once

// Reading a manifest (a structured-value document) from a bundle or a
// configuration directory without trusting what is found there: the file must
// be a regular file, so a FIFO or device planted under a manifest's name is
// refused instead of blocking the reader, and it is read within the document
// size limit.

#include <string>

#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace bundle {

// Opens path for reading (never blocking on a FIFO) and reads it as a document
// (tn::readDocument, XML or JSON). Errors are document errors of
// tn::kDocumentErrorDomain: Unreadable ("<path>: cannot read: <reason>",
// also for anything but a regular file), TooLarge, or what the reader found.
tn::Result<tn::Value> readManifestFile(const std::string& path);

// The same for a file already open as fd (which stays open and is read from
// its current offset); path is only named in errors.
tn::Result<tn::Value> readManifestDescriptor(int fd, const std::string& path);

// Opens path read-only, close-on-exec and without blocking; -1 with errno
// set on failure. For callers that check the open file before reading it.
int openManifestFile(const std::string& path);

}  // namespace bundle
