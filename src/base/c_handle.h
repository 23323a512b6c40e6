// An owning pointer for an object of a C library, released with the library's own
// function when its owner goes: CHandle<EVP_PKEY, EVP_PKEY_free>, CHandle<udev,
// udev_unref>. One template for every library, so no file writes its own deleter.
#pragma once

#include <memory>

namespace brisvale {

template <auto Release>
struct ReleaseWith {
  template <typename T>
  void operator()(T* object) const {
    Release(object);
  }
};

template <typename T, auto Release>
using CHandle = std::unique_ptr<T, ReleaseWith<Release>>;

}  // namespace brisvale
