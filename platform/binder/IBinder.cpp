#include <binder/IBinder.h>
#include <binder/IInterface.h>

namespace android {

IBinder::IBinder() : RefBase() {}

IBinder::~IBinder() {}

sp<IInterface> IBinder::queryLocalInterface(const String16& descriptor) {
    return nullptr;
}

bool IBinder::checkSubclass(const void* subclassID) const {
    return false;
}

BBinder* IBinder::localBinder() {
    return nullptr;
}

BpBinder* IBinder::remoteBinder() {
    return nullptr;
}

} // namespace android
