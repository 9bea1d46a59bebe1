// Server paths at the neon boundary: the library speaks unescaped paths
// ("/Web/.Temporary Web Resources/..."), neon and the wire escaped ones.
#pragma once

#include <string>
#include <string_view>

namespace vtc::davpath {

// Percent-escapes everything but unreserved characters and "/".
std::string escape(std::string_view path);

// The path of an href (absolute URL or path), percent-decoded.
std::string fromHref(std::string_view href);

// One canonical form for comparing unescaped paths: without a trailing "/"
// (except the root).
std::string canonical(std::string_view path);

// The path of a collection as servers name it: with one trailing "/".
std::string collection(std::string_view path);

// The parent folder path, with a trailing "/"; "/" for top-level paths.
std::string parent(std::string_view path);

// The last path component, ignoring one trailing "/".
std::string lastComponent(std::string_view path);

}  // namespace vtc::davpath
