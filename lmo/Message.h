#pragma once
// Message dictionaries and the conversions between them and property lists.
//
// Messages and property lists share one value type, so the standard
// conversion between them is the identity on the value; the functions below
// keep the names the rest of the system reads naturally, and enforce the one
// real rule: a whole message is a dictionary.

#include <optional>

#include "lmo/Value.h"

namespace vantrel::lmo {

// The value under key when it is an array; nullopt when missing or of
// another type.
std::optional<Array> lmo_dictionary_get_array(const Dictionary& message, const char* key);
// The value under key when it is a dictionary; nullopt otherwise.
std::optional<Dictionary> lmo_dictionary_get_dictionary(const Dictionary& message, const char* key);

// A property-list object as a whole message: the dictionary itself, or
// nullopt when the object is not a dictionary.
std::optional<Dictionary> messageFromPropertyList(const Value& object);
// A message dictionary as an ordinary property-list dictionary.
Dictionary propertyListFromMessage(const Dictionary& message);
// A property-list object as a message value for a peer speaking version
// (a match reply's "matches" is an array of forms); nullopt unless version is
// protocol::kCurrentVersion, whose peers are the only ones that read it.
std::optional<Value> convertToLMO(const Value& object, uint64_t version);

}  // namespace vantrel::lmo
