/// @file
/// kivcore::proplist::PropList: a small string-to-string property list handed
/// to initializers.
///
/// Threading: a value type; not synchronised.
#pragma once

#include <kivcore/Export.h>

#include <map>
#include <string>

namespace kivcore::proplist {

/// A small string-to-string property list handed to initializers; a value
/// type, not synchronised.
class KIVCORE_API PropList {
public:
  /// Sets inKey to inValue, replacing any earlier value.
  void Set(const std::string& inKey, const std::string& inValue);
  /// inDefault when the key is absent.
  std::string Get(const std::string& inKey, const std::string& inDefault = std::string()) const;
  /// Whether inKey has a value.
  bool Has(const std::string& inKey) const;

private:
  std::map<std::string, std::string> mValues;
};

}  // namespace kivcore::proplist
