#include "handlers/ThermalRecords.h"

#include <binder/Parcel.h>
#include <errno.h>
#include <stdlib.h>
#include <utils/String16.h>
#include <utils/String8.h>

#include <functional>

using android::Parcel;

namespace kelvo {

namespace {

bool readText(const Parcel& in, std::string* out) {
    size_t units = 0;
    const char16_t* text = in.readString16Inplace(&units);
    if (text == nullptr || units > ThermalRecords::kMaxTextUnits) {
        return false;
    }
    android::String8 utf8(android::String16(text, units));
    out->assign(utf8.string(), utf8.size());
    return true;
}

bool readInt(const Parcel& in, int32_t* out) {
    return in.readInt32(out) == android::NO_ERROR;
}

bool readLong(const Parcel& in, int64_t* out) {
    return in.readInt64(out) == android::NO_ERROR;
}

// A length from the entry, within what is left of it; the bytes it covers
// as a parcel of their own.
bool readSection(const Parcel& in, Parcel* section) {
    int32_t length = 0;
    if (!readInt(in, &length) || length < 0 || static_cast<size_t>(length) > in.dataAvail()) {
        return false;
    }
    const void* bytes = in.readInplace(static_cast<size_t>(length));
    if (length > 0 && bytes == nullptr) {
        return false;
    }
    if (length > 0) {
        section->setData(static_cast<const uint8_t*>(bytes), static_cast<size_t>(length));
    }
    section->setDataPosition(0);
    return true;
}

// Pairs of (range text, int32 count) filling the section exactly.
bool readPairs(const Parcel& section, const std::function<void(std::string, int32_t)>& add) {
    while (section.dataAvail() > 0) {
        std::string range;
        int32_t count = 0;
        if (!readText(section, &range) || !readInt(section, &count)) {
            return false;
        }
        add(std::move(range), count);
    }
    return true;
}

bool readScene(const Parcel& in, ThermalRecords::heat_scene* s) {
    bool ok = readLong(in, &s->startTime) && readLong(in, &s->endTime) &&
              readText(in, &s->currentPackage) && readText(in, &s->previousPackage) &&
              readInt(in, &s->startTemperature) && readInt(in, &s->endTemperature) &&
              readInt(in, &s->topTemperature) && readLong(in, &s->topTime) &&
              readInt(in, &s->brightness) && readInt(in, &s->mediaVolume);
    for (int32_t i = 0; ok && i < ThermalRecords::kSceneInts; ++i) {
        ok = readInt(in, &s->values[i]);
    }
    ok = ok && readInt(in, &s->ambientTemperature) && readInt(in, &s->averagePower);
    for (int32_t i = 0; ok && i < 3; ++i) {
        ok = readText(in, &s->topPackages[i]);
    }
    return ok && readInt(in, &s->wifiTemp) && readInt(in, &s->ambientTemperature2);
}

// A count whose records, each at least minSize bytes, fit in what is left.
bool readCount(const Parcel& in, size_t minSize, int32_t* count) {
    return readInt(in, count) && *count >= 0 &&
           static_cast<size_t>(*count) <= in.dataAvail() / minSize;
}

}  // namespace

int32_t ThermalRecords::parse(const uint8_t* data, size_t size, daily* out) {
    *out = daily();
    if (data == nullptr || size < sizeof(int64_t)) {
        return kMalformed;
    }
    Parcel in;
    if (in.setData(data, size) != android::NO_ERROR) {
        return kMalformed;
    }
    in.setDataPosition(0);
    readLong(in, &out->dayStamp);
    while (in.dataAvail() > 0) {
        int32_t type = 0;
        if (!readInt(in, &type)) {
            return kMalformed;
        }
        if (type == BLOCK_APPLICATIONS) {
            int32_t n = 0;
            if (!readCount(in, kMinApplicationSize, &n)) {
                return kMalformed;
            }
            for (int32_t i = 0; i < n; ++i) {
                std::string name;
                Parcel pairs;
                if (!readText(in, &name) || !readSection(in, &pairs) ||
                    !readPairs(pairs, [out, &name](std::string range, int32_t count) {
                        out->applications.push_back({name, std::move(range), count});
                    })) {
                    return kMalformed;
                }
            }
        } else if (type == BLOCK_SHELL) {
            Parcel pairs;
            if (!readSection(in, &pairs) ||
                !readPairs(pairs, [out](std::string range, int32_t count) {
                    out->shell.push_back({std::move(range), count});
                })) {
                return kMalformed;
            }
        } else if (type == BLOCK_HEAT_SCENES) {
            int32_t n = 0;
            if (!readCount(in, kMinSceneSize, &n)) {
                return kMalformed;
            }
            for (int32_t i = 0; i < n; ++i) {
                heat_scene scene;
                if (!readScene(in, &scene)) {
                    return kMalformed;
                }
                out->scenes.push_back(std::move(scene));
            }
        } else {
            out->unknownType = type;
            return kUnknownBlock;
        }
    }
    return kComplete;
}

int64_t ThermalRecords::rangeIndex(const std::string& name) {
    static const char kPrefix[] = "Range";
    const size_t prefix = sizeof(kPrefix) - 1;
    if (name.compare(0, prefix, kPrefix) != 0 || name.size() == prefix || name.size() > prefix + 9 ||
        name.find_first_not_of("0123456789", prefix) != std::string::npos) {
        return -1;
    }
    return strtoll(name.c_str() + prefix, nullptr, 10);
}

}  // namespace kelvo
