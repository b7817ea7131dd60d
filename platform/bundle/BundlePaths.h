#pragma once

// Path arithmetic for bundles: making paths absolute and finding the bundle an
// executable lies in. Nothing here follows symbolic links; the walk looks at
// directory entries only.

#include <optional>
#include <string>
#include <string_view>

namespace bundle {

// path made absolute against the current directory and lexically normalised:
// "." and ".." segments and repeated or trailing slashes removed
// ("a/../b/" in /x gives "/x/b"). Empty for an empty path; a relative path
// stays relative (normalised) when the current directory cannot be read.
std::string absoluteBundlePath(std::string_view path);

// directory + "/" + name, without doubling a slash that ends directory.
std::string joinPath(const std::string& directory, std::string_view name);

// The nearest directory above executablePath (which must be absolute and
// normalised) holding an entry named Info.manifest, searching the
// executable's own directory first and ending with "/". An entry of any type
// counts, even a dangling link: a bundle with a broken manifest is still the
// bundle the executable belongs to. None when no directory up to "/" has one.
std::optional<std::string> findEnclosingBundle(const std::string& executablePath);

}  // namespace bundle
