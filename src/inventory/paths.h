// Text and URL helpers of the inventory: device nodes become URLs whose last path
// component is the kernel's device name, and image paths split into components.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/plist.h"

namespace brisvale::paths {

// `text` read as a URL string: none when it is empty or holds a character a URL may
// not carry unescaped (space, controls, non-ASCII, <>"{}|\^` or a stray '%').
std::optional<std::string> UrlFromText(std::string_view text);
// A "file://" URL for an absolute or relative path, characters outside the URL set
// escaped; none for an empty path.
std::optional<std::string> FileUrlFromPath(std::string_view path);
// The URL's last path component, escapes left as they stand ("disk2s1" for
// "file:///dev/disk2s1", "/" for a root path); none when the URL has no path.
std::optional<std::string_view> LastPathComponent(std::string_view url);
// "/" first for an absolute path, then each non-empty component.
std::vector<std::string_view> PathComponents(std::string_view path);
// One character per byte.
std::string Latin1ToUtf8(const plist::Bytes& bytes);

}  // namespace brisvale::paths
