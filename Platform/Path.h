// Paths. The daemon represents the platform's file URLs as absolute host
// paths in std::string: the root prefix is already applied, there is no
// trailing slash (except "/"), and components are joined with PathJoin.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace tarn {

using FileURL = std::string;

std::string PathJoin(std::string_view base, std::string_view component);
std::string PathLastComponent(std::string_view path);
// The same as a view into `path`, for callers that only look at it.
std::string_view PathLastComponentView(std::string_view path);
std::string PathParent(std::string_view path);  // "/" for "/x"; "" for ""
std::vector<std::string> PathComponents(std::string_view path);  // no empty components
// Removes "." components, duplicate and trailing slashes; keeps "..".
std::string PathStandardize(std::string_view path);
bool PathHasDotDotComponent(std::string_view path);

}  // namespace tarn
