// Checked downcasts from a generic protobuf message to a generated type, by
// descriptor (no RTTI lookup through the class hierarchy).
#pragma once

#include <google/protobuf/message.h>

namespace fbf {

template <class T>
const T* messageAs(const google::protobuf::Message& m) {
  return m.GetDescriptor() == T::descriptor() ? static_cast<const T*>(&m) : nullptr;
}

template <class T>
T* messageAs(google::protobuf::Message& m) {
  return m.GetDescriptor() == T::descriptor() ? static_cast<T*>(&m) : nullptr;
}

}  // namespace fbf
