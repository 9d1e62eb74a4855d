// Checked downcasts from a generic protobuf message to a generated type, by
// descriptor (no RTTI lookup through the class hierarchy).
#pragma once

#include <google/protobuf/message.h>

namespace fbf {

// T::descriptor() goes through protobuf's once-only initialisation on every
// call; the rewrite asks this for every message it meets.
template <class T>
const google::protobuf::Descriptor* descriptorOf() {
  static const google::protobuf::Descriptor* const descriptor = T::descriptor();
  return descriptor;
}

template <class T>
const T* messageAs(const google::protobuf::Message& m) {
  return m.GetDescriptor() == descriptorOf<T>() ? static_cast<const T*>(&m) : nullptr;
}

template <class T>
T* messageAs(google::protobuf::Message& m) {
  return m.GetDescriptor() == descriptorOf<T>() ? static_cast<T*>(&m) : nullptr;
}

}  // namespace fbf
