// Node names and endpoints (Endpoint.cpp).
#pragma once

#include <string>

namespace Tarn::Remote {

// Letters, digits, '-', '_' and '.', not empty, not "." or "..": a name that
// stays one path component.
bool IsValidNodeName(const std::string& inName);

}  // namespace Tarn::Remote
