// Path-string arithmetic shared by the parts of the file manager. Nothing
// here touches the file system.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace QRVPathComponents {

// Components as the path-safety rules count them: a leading "/" is a
// component of its own, empty components vanish, a trailing "/" adds nothing.
std::vector<std::string> split(std::string_view path);
// Joins components [begin, end) back into a path.
std::string join(const std::vector<std::string>& components, size_t begin, size_t end);

// "/a/b" -> "/a", "/a" -> "/", "a" -> "" (trailing slashes ignored).
std::string deletingLast(std::string path);
// The directory holding `path`; "." for a bare name.
std::string parentDirectory(const std::string& path);
std::string appending(const std::string& path, const std::string& component);
std::string last(const std::string& path);

// The "/private" prefix names the same place as the path without it.
std::string withoutPrivatePrefix(const std::string& path);

}  // namespace QRVPathComponents
