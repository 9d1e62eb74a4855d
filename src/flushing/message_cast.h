// Checked downcasts from a generic protobuf message to a generated type.
#pragma once

#include <google/protobuf/message.h>

#include <typeinfo>

namespace fbf {

// By exact dynamic type: a comparison of type_info objects, where asking
// the message for its descriptor takes protobuf's once-only path on every
// call. It also refuses a dynamic message that shares the generated type's
// descriptor, which a cast by descriptor would have let through.
template <class T>
const T* messageAs(const google::protobuf::Message& m) {
  return typeid(m) == typeid(T) ? static_cast<const T*>(&m) : nullptr;
}

template <class T>
T* messageAs(google::protobuf::Message& m) {
  return typeid(m) == typeid(T) ? static_cast<T*>(&m) : nullptr;
}

}  // namespace fbf
