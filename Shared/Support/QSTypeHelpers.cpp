#include "Shared/Support/QSUtilities.h"

using platform::Array;
using platform::Value;

namespace {

// Signed and unsigned integers are one class; every other type is its own.
bool isIntegerType(Value::Type type) { return type == Value::Type::Integer || type == Value::Type::Unsigned; }

}  // namespace

bool QSObjectIsKindOfClass(const Value& object, Value::Type cls) {
  if (isIntegerType(cls)) return isIntegerType(object.type());
  return object.type() == cls;
}

std::optional<std::string> QSStringifyObject(const Value& object) {
  if (object.isNull()) return std::nullopt;
  if (const std::string* string = object.asString()) return *string;
  return object.description();
}

bool QSArrayContainsOnlyClass(const Value& collection, Value::Type cls) {
  if (collection.isNull()) return true;
  if (const Array* array = collection.asArray()) {
    for (const Value& element : *array) {
      if (!QSObjectIsKindOfClass(element, cls)) return false;
    }
    return true;
  }
  if (const platform::Dictionary* dictionary = collection.asDictionary()) {
    for (const auto& entry : *dictionary) {
      if (!QSObjectIsKindOfClass(Value(entry.first), cls)) return false;
    }
    return true;
  }
  return false;
}

bool QSBooleanValue(const Value& object, bool defaultValue) {
  if (!object.isNumber()) return defaultValue;
  return object.boolValue(defaultValue);
}

std::optional<Array> QSArrayifyThing(const Value& object, Value::Type cls) {
  if (object.isNull()) return std::nullopt;
  if (const Array* array = object.asArray()) {
    if (!QSArrayContainsOnlyClass(object, cls)) return std::nullopt;
    return *array;
  }
  if (QSObjectIsKindOfClass(object, cls)) return Array{object};
  return std::nullopt;
}
