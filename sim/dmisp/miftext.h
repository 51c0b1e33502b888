// MIF text: parsing into a component and writing a component back.
#pragma once

#include <string>

#include "dmisp/model.h"

namespace dmisp {

// Parses MIF text. On success fills *out (component id left 0) and returns
// true; otherwise *error = "<fileName>:<line>: <reason>" and *out is untouched.
bool parseMif(const std::string& text, const std::string& fileName, Component* out, std::string* error);

// MIF text that parseMif reads back to the same content (names, ids,
// attributes, enumerations, rows and current values).
std::string writeMif(const Component& c);

} // namespace dmisp
