#pragma once
// Small operations on the value type's collections that the model and the
// request handlers share.

#include <string_view>
#include <utility>
#include <vector>

#include "lmo/Value.h"

namespace vantrel::model {

// The non-null results of block(value) for each value of values, in the
// collection's order. block returns an lmo::Value (or something convertible
// to one); a null result is dropped.
template <typename Collection, typename Block>
lmo::Array arrayWithValues(const Collection& values, Block&& block) {
  std::vector<lmo::Value> out;
  for (const auto& value : values) {
    lmo::Value result = block(value);
    if (!result.isNull()) out.push_back(std::move(result));
  }
  return lmo::Array(std::move(out));
}

// A copy of dict in which key maps to value, or without key when value is
// null. dict itself is unchanged (values are immutable, so the copy can never
// see a later change made by the caller).
lmo::Dictionary dictionaryChanging(const lmo::Dictionary& dict, std::string_view key,
                                   const lmo::Value& value);

}  // namespace vantrel::model
