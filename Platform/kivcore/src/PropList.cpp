#include <kivcore/PropList.h>

namespace kivcore::proplist {

void PropList::Set(const std::string& inKey, const std::string& inValue) { mValues[inKey] = inValue; }

std::string PropList::Get(const std::string& inKey, const std::string& inDefault) const {
  auto found = mValues.find(inKey);
  return found != mValues.end() ? found->second : inDefault;
}

bool PropList::Has(const std::string& inKey) const { return mValues.count(inKey) != 0; }

}  // namespace kivcore::proplist
