#pragma once

// Reading the arguments of tnctl's daemon subcommands. Each function fails
// the command (fail()) with one line naming the bad argument.

#include <string>
#include <vector>

#include "libtenon/client/TNDaemonClient.h"
#include "platform/value/URL.h"
#include "platform/value/UUID.h"
#include "platform/value/Value.h"

namespace tnctl {

// A flags word: decimal, or hexadecimal with "0x" ("0x200").
uint64_t parseFlags(const std::string& text);

// A structured value given inline as JSON (or XML), or as "@FILE" naming a
// document file. `what` names the argument in error messages.
tn::Value readValueArgument(const std::string& text, const std::string& what);
// The same, required to be a dictionary.
tn::Dictionary readDictionaryArgument(const std::string& text, const std::string& what);

tn::UUID parseUUID(const std::string& text);
std::vector<tn::UUID> parseUUIDs(const std::vector<std::string>& texts);

// The daemon wants absolute paths; relative ones are taken from the current
// directory (not resolved further: the daemon resolves links itself).
std::string absolutePath(const std::string& path);
std::vector<std::string> absolutePaths(const std::vector<std::string>& paths);

// "UUID=PATH" pairs, in the order given.
tn::PlugInsByPath parsePlugIns(const std::vector<std::string>& pairs);

// A URL ("file:///opt/A.tnx"), or a path taken as a file URL.
tn::URL parseURLOrPath(const std::string& text);

}  // namespace tnctl
