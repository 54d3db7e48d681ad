// The root prefix: every absolute path the daemon names lives below it
// (`tarnkeeperd --root DIR`, default "/"), so tests, benchmarks and demos run
// in a scratch tree. Set once at process start, before any other thread runs.
#pragma once

#include <string>
#include <string_view>

namespace tarn {

void SetRootPrefix(std::string dir);  // normalised: no trailing slash except "/"
const std::string& RootPrefix();
bool RootIsSystemRoot();
// `absolutePath` ("/private/var/...") placed under the root prefix.
std::string RootPath(std::string_view absolutePath);
// The inverse for display and metadata: strips the prefix when present.
std::string StripRootPrefix(std::string_view path);

}  // namespace tarn
