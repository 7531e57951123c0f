#pragma once

#include <stdint.h>

#include <mutex>
#include <vector>

#include <binder/Parcel.h>
#include <tinyxml2.h>

namespace kelvo {

// Component ids of the power profile (element 0). The numbering is the
// profile's own, not AccounterType's.
enum ProfileComponent {
    PROFILE_SCREEN_BRIGHTNESS = 0, // simple: slope, intercept
    PROFILE_GNSS = 1,              // simple: power
    PROFILE_FLASHLIGHT = 2,        // simple: power
    PROFILE_CPU = 3,               // grouped from here on
    PROFILE_CAMERA = 4,
    PROFILE_WIFI = 5,
    PROFILE_BLUETOOTH = 6,
    PROFILE_SENSOR = 7,
    PROFILE_MODEM = 8,
    PROFILE_GPU = 9,
    PROFILE_AUDIO = 10,
    PROFILE_DPM = 11,
};

// One value of a grouped reply; key is 0 when the request asked for no keys.
struct config_value {
    int32_t key;
    int32_t value;
};

// One parameter of a grouped reply with its values in document order.
struct config_parameter {
    int32_t id;
    std::vector<config_value> values;
};

// The configuration file: power profile, thresholds, policies, filters,
// settings and texts. Loaded once, on first use, from
// "/data/misc/kelvo/tv_kelvo_config.xml" or else from the customisation
// location of "xml/tv_kelvo_config.xml"; without either every lookup fails
// and callers keep their defaults.
//
// Request parcel: int32 component id; grouped kinds add int32 parameter id
// (-1 for all) and bool keyed.
// Reply parcel, always rewound to 0 and holding only this lookup's answer:
//   simple  one int32 per parameter, in document order;
//   text    one String8 per parameter;
//   grouped per selected parameter: int32 id, then per value int32 1,
//           [int32 key when keyed], int32 value; int32 -1 ends the values.
//           int32 -1 ends the parameters.
class XmlParser {
public:
    // The process's parser, created (and the file loaded) on first use.
    static XmlParser* getInstance();
    // Drops the process's parser so that the next getInstance() loads the
    // file again from the current root. For tests and fuzzing only: no
    // lookup may be running, and no pointer to the old parser may be kept.
    static void resetInstance();

    // Reads a grouped reply from its start into parameters. 0 when the reply
    // was complete; -1 when it ended before its final -1 (a cut or empty
    // reply), and then parameters is left empty so that the caller keeps its
    // defaults. Never reads past the end of the reply.
    static int32_t readGroupedReply(const android::Parcel& reply, bool keyed,
                                    std::vector<config_parameter>* parameters);

    // Replaces the loaded document with the file at path. 0 when it loaded
    // and has a root element, else -1 and no document.
    int32_t openXmlFile(const char* path);

    // One lookup (see above). 0 or -1. Element ids above 1000 are refused.
    int32_t getXmlConfig(int32_t element, const android::Parcel& request,
                         android::Parcel* reply);

private:
    XmlParser();
    ~XmlParser() = default;
    XmlParser(const XmlParser&) = delete;
    XmlParser& operator=(const XmlParser&) = delete;

    int32_t loadLocked(const char* path);
    int32_t parseElements(int32_t element, const android::Parcel& request,
                          android::Parcel* reply);
    int32_t parseComponents(int32_t element, const tinyxml2::XMLElement* node,
                            const android::Parcel& request, android::Parcel* reply);
    int32_t getSimpleParameters(const tinyxml2::XMLElement* component, android::Parcel* reply);
    int32_t getTextParameters(const tinyxml2::XMLElement* component, android::Parcel* reply);
    int32_t getGroupedParameters(const tinyxml2::XMLElement* component,
                                 const android::Parcel& request, android::Parcel* reply);
    // The first child named name whose integer "id" equals id; null when
    // there is none or when a child without a readable id comes first.
    const tinyxml2::XMLElement* findById(const tinyxml2::XMLElement* parent, const char* name,
                                         int32_t id);

    // Guards the document: tinyxml2 finishes decoding texts and attributes
    // on their first read, so even lookups write to it.
    std::mutex mLock;
    tinyxml2::XMLDocument mDocument;
    const tinyxml2::XMLElement* mRoot;
};

} // namespace kelvo
