// The version text both tools print for --version.
#ifndef KOVA_TOOLS_COMMON_TOOL_VERSION_H
#define KOVA_TOOLS_COMMON_TOOL_VERSION_H

#include <string>

namespace kova_tools {

// One "NAME VERSION" line each for `tool` itself, then for the libkovacredential, libcurl,
// OpenSSL, SQLite and jsoncpp the process has loaded (not the ones it was built against);
// "unknown" where a loaded library does not tell.
std::string VersionText(const std::string &tool);

}  // namespace kova_tools

#endif  // KOVA_TOOLS_COMMON_TOOL_VERSION_H
