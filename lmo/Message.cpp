#include "lmo/Message.h"

#include "lmo/Protocol.h"

namespace vantrel::lmo {

std::optional<Array> lmo_dictionary_get_array(const Dictionary& message, const char* key) {
  if (key == nullptr) return std::nullopt;
  if (const Array* a = message.get(key).getIfArray()) return *a;
  return std::nullopt;
}

std::optional<Dictionary> lmo_dictionary_get_dictionary(const Dictionary& message,
                                                        const char* key) {
  if (key == nullptr) return std::nullopt;
  if (const Dictionary* d = message.get(key).getIfDictionary()) return *d;
  return std::nullopt;
}

std::optional<Dictionary> messageFromPropertyList(const Value& object) {
  if (const Dictionary* d = object.getIfDictionary()) return *d;
  return std::nullopt;
}

Dictionary propertyListFromMessage(const Dictionary& message) {
  return message;
}

std::optional<Value> convertToLMO(const Value& object, uint64_t version) {
  if (version != protocol::kCurrentVersion) return std::nullopt;
  // Messages and property lists share one value type: the conversion is the
  // value itself, whatever its kind.
  return object;
}

}  // namespace vantrel::lmo
