#include "model/Collections.h"

namespace vantrel::model {

lmo::Dictionary dictionaryChanging(const lmo::Dictionary& dict, std::string_view key,
                                   const lmo::Value& value) {
  return value.isNull() ? dict.removing(key) : dict.setting(key, value);
}

}  // namespace vantrel::model
