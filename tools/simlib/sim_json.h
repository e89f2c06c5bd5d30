// JSON text for the simulators: their own parser and writer settings, kept apart from the
// library's so that a server does not share the client's reading of a document.
#ifndef KOVASIM_SIM_JSON_H
#define KOVASIM_SIM_JSON_H

#include <string>

#include <json/value.h>

namespace kovasim {

// Parses `text` as one strict JSON document (an object or array at the root, or, with
// `anyRoot`, any value); false for an empty or malformed text. Each thread keeps its readers.
bool ParseJson(const std::string &text, Json::Value &value, bool anyRoot = false);

// The compact text of `value` (no indentation).
std::string WriteJson(const Json::Value &value);

}  // namespace kovasim

#endif  // KOVASIM_SIM_JSON_H
