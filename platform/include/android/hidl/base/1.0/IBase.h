#pragma once

#include <utils/RefBase.h>

namespace android {
namespace hidl {
namespace base {
namespace V1_0 {

// The base of every hardware-binder interface.
class IBase : public virtual RefBase {
public:
    virtual ~IBase() = default;
};

} // namespace V1_0
} // namespace base
} // namespace hidl
} // namespace android
