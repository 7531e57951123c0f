#include "utils/XmlParser.h"

#include <ctype.h>
#include <errno.h>
#include <stdlib.h>

#include <string>

#include <cust/CustConfig.h>
#include <utils/String8.h>

#include "KelvoLibEntry.h"
#include "LibKelvoLog.h"
#include "kelvo/RootPath.h"

using android::NO_ERROR;
using android::Parcel;
using tinyxml2::XMLElement;

namespace kelvo {

namespace {

constexpr const char* kDataConfigPath = "/data/misc/kelvo/tv_kelvo_config.xml";
constexpr const char* kCustConfigSuffix = "xml/tv_kelvo_config.xml";

// Grouped replies: the end of a parameter's values, or of the parameters.
constexpr int32_t kGroupEnd = -1;
// Grouped replies: a value follows.
constexpr int32_t kValueFollows = 1;

// Counts of the typed components.
constexpr int32_t kProfileSimpleLast = PROFILE_FLASHLIGHT;
constexpr int32_t kProfileGroupedLast = PROFILE_DPM;
constexpr int32_t kPolicyCount = 6;
constexpr int32_t kFilterCount = 2;
constexpr int32_t kSettingsCount = 1;

// A decimal int32, with surrounding white space allowed and nothing else:
// "12abc", "0x10" and values beyond int32 are not integers.
bool parseInt32(const char* text, int32_t* out) {
    if (text == nullptr) {
        return false;
    }
    while (isspace(static_cast<unsigned char>(*text))) {
        ++text;
    }
    if (*text == '\0') {
        return false;
    }
    errno = 0;
    char* end = nullptr;
    long long value = strtoll(text, &end, 10);
    if (end == text || errno == ERANGE || value < INT32_MIN || value > INT32_MAX) {
        return false;
    }
    while (isspace(static_cast<unsigned char>(*end))) {
        ++end;
    }
    if (*end != '\0') {
        return false;
    }
    *out = static_cast<int32_t>(value);
    return true;
}

std::mutex& instanceLock() {
    static std::mutex* lock = new std::mutex();
    return *lock;
}

XmlParser* gInstance = nullptr;

} // namespace

XmlParser* XmlParser::getInstance() {
    std::lock_guard<std::mutex> guard(instanceLock());
    if (gInstance == nullptr) {
        gInstance = new XmlParser();
    }
    return gInstance;
}

void XmlParser::resetInstance() {
    std::lock_guard<std::mutex> guard(instanceLock());
    delete gInstance;
    gInstance = nullptr;
}

XmlParser::XmlParser() : mRoot(nullptr) {
    std::string dataPath = RootPath::resolve(kDataConfigPath);
    if (loadLocked(dataPath.c_str()) == 0) {
        return;
    }
    char buffer[CUST_CFG_PATH_MAX] = {};
    const char* custPath = get_one_cfg_file(kCustConfigSuffix, buffer, 0);
    if (custPath == nullptr) {
        LLOGE("Failed to get configuration file");
        return;
    }
    if (loadLocked(custPath) != 0) {
        LLOGE("Failed to open xml file, running without configuration");
    }
}

int32_t XmlParser::openXmlFile(const char* path) {
    if (path == nullptr) {
        LLOGE("Invalid parameter");
        return -1;
    }
    std::lock_guard<std::mutex> guard(mLock);
    return loadLocked(path);
}

int32_t XmlParser::loadLocked(const char* path) {
    mRoot = nullptr;
    tinyxml2::XMLError err = mDocument.LoadFile(path);
    if (err != tinyxml2::XML_SUCCESS) {
        // A missing file is the usual case for the first location.
        if (err != tinyxml2::XML_ERROR_FILE_NOT_FOUND) {
            LLOGE("Failed to load %s: %s", path, mDocument.ErrorStr());
        }
        mDocument.Clear();
        return -1;
    }
    const XMLElement* root = mDocument.FirstChildElement();
    if (root == nullptr) {
        LLOGE("No root element found");
        mDocument.Clear();
        return -1;
    }
    mRoot = root;
    LLOGI("Using xml: %s", path);
    return 0;
}

int32_t XmlParser::getXmlConfig(int32_t element, const Parcel& request, Parcel* reply) {
    if (reply == nullptr) {
        LLOGE("Invalid parameter");
        return -1;
    }
    if (element < CONFIG_POWER_PROFILE || element > CONFIG_TEXT) {
        LLOGE("Invalid element id: %d", element);
        return -1;
    }
    std::lock_guard<std::mutex> guard(mLock);
    // The reply holds this lookup's answer only, even in a reused parcel.
    reply->setDataSize(0);
    reply->setDataPosition(0);
    if (mRoot == nullptr) {
        LLOGE("Invalid root element");
        return -1;
    }
    int32_t ret = parseElements(element, request, reply);
    reply->setDataPosition(0);
    if (ret < 0) {
        LLOGE("Failed to parse xml element: %d", element);
        return -1;
    }
    return 0;
}

const XMLElement* XmlParser::findById(const XMLElement* parent, const char* name, int32_t id) {
    for (const XMLElement* node = parent->FirstChildElement(name); node != nullptr;
         node = node->NextSiblingElement(name)) {
        int32_t nodeId = 0;
        if (!parseInt32(node->Attribute("id"), &nodeId)) {
            // Whatever follows cannot be told apart safely: the lookup fails.
            LLOGE("Failed to get attribute id of %s", name);
            return nullptr;
        }
        if (nodeId == id) {
            return node;
        }
    }
    return nullptr;
}

int32_t XmlParser::parseElements(int32_t element, const Parcel& request, Parcel* reply) {
    request.setDataPosition(0);
    const XMLElement* node = findById(mRoot, "element", element);
    if (node == nullptr) {
        return -1;
    }
    return parseComponents(element, node, request, reply);
}

int32_t XmlParser::parseComponents(int32_t element, const XMLElement* node, const Parcel& request,
                                   Parcel* reply) {
    int32_t component = 0;
    if (request.readInt32(&component) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    const XMLElement* componentNode = findById(node, "component", component);
    if (componentNode == nullptr) {
        return -1;
    }
    switch (element) {
        case CONFIG_POWER_PROFILE:
            if (component >= 0 && component <= kProfileSimpleLast) {
                return getSimpleParameters(componentNode, reply);
            }
            if (component > kProfileSimpleLast && component <= kProfileGroupedLast) {
                return getGroupedParameters(componentNode, request, reply);
            }
            LLOGE("Unknown power profile type: %d", component);
            return 0;
        case CONFIG_ABNORMALITY_THRESHOLD:
            return getGroupedParameters(componentNode, request, reply);
        case CONFIG_COMPONENT_POLICY:
            if (component < 0 || component >= kPolicyCount) {
                LLOGE("Invalid component policy type: %d", component);
                return -1;
            }
            return getSimpleParameters(componentNode, reply);
        case CONFIG_FILTER:
            if (component < 0 || component >= kFilterCount) {
                LLOGE("Invalid filter type: %d", component);
                return -1;
            }
            return getSimpleParameters(componentNode, reply);
        case CONFIG_SETTINGS:
            if (component < 0 || component >= kSettingsCount) {
                LLOGE("Invalid settings type: %d", component);
                return -1;
            }
            return getSimpleParameters(componentNode, reply);
        case CONFIG_TEXT:
            return getTextParameters(componentNode, reply);
        default:
            LLOGE("Unknown element id: %d", element);
            return 0;
    }
}

int32_t XmlParser::getSimpleParameters(const XMLElement* component, Parcel* reply) {
    const XMLElement* parameter = component->FirstChildElement("parameter");
    if (parameter == nullptr) {
        return -1;
    }
    for (; parameter != nullptr; parameter = parameter->NextSiblingElement("parameter")) {
        int32_t value = 0;
        if (!parseInt32(parameter->GetText(), &value)) {
            // The values before it stand; the list ends here.
            LLOGE("Failed to get parameter of %s", "component");
            break;
        }
        reply->writeInt32(value);
    }
    return 0;
}

int32_t XmlParser::getTextParameters(const XMLElement* component, Parcel* reply) {
    for (const XMLElement* parameter = component->FirstChildElement("parameter");
         parameter != nullptr; parameter = parameter->NextSiblingElement("parameter")) {
        const char* text = parameter->GetText();
        if (text == nullptr) {
            LLOGE("Failed to get parameter of %s", "component");
            return -1;
        }
        reply->writeString8(android::String8(text));
    }
    return 0;
}

int32_t XmlParser::getGroupedParameters(const XMLElement* component, const Parcel& request,
                                        Parcel* reply) {
    int32_t wanted = 0;
    bool keyed = false;
    if (request.readInt32(&wanted) != NO_ERROR || request.readBool(&keyed) != NO_ERROR) {
        LLOGE("Invalid parameter");
        return -1;
    }
    const XMLElement* parameter = component->FirstChildElement("parameter");
    if (parameter == nullptr) {
        reply->writeInt32(kGroupEnd);
        return -1;
    }
    for (; parameter != nullptr; parameter = parameter->NextSiblingElement("parameter")) {
        int32_t id = 0;
        // An id of -1 would read as the end of the reply.
        if (!parseInt32(parameter->Attribute("id"), &id) || id == kGroupEnd) {
            LLOGE("Failed to get attribute id of %s", "parameter");
            reply->writeInt32(kGroupEnd);
            return -1;
        }
        if (wanted != kGroupEnd && id != wanted) {
            continue;
        }
        reply->writeInt32(id);
        for (const XMLElement* value = parameter->FirstChildElement("value"); value != nullptr;
             value = value->NextSiblingElement("value")) {
            int32_t key = 0;
            if (keyed && !parseInt32(value->Attribute("key"), &key)) {
                LLOGE("Failed to get value attribute key of %s", "parameter");
                break;
            }
            int32_t number = 0;
            if (!parseInt32(value->GetText(), &number)) {
                LLOGE("Failed to get value of %s", "parameter");
                break;
            }
            // The mark goes out only with a complete value behind it.
            reply->writeInt32(kValueFollows);
            if (keyed) {
                reply->writeInt32(key);
            }
            reply->writeInt32(number);
        }
        reply->writeInt32(kGroupEnd);
        if (id == wanted) {
            break;
        }
    }
    reply->writeInt32(kGroupEnd);
    return 0;
}

int32_t XmlParser::readGroupedReply(const Parcel& reply, bool keyed,
                                    std::vector<config_parameter>* parameters) {
    if (parameters == nullptr) {
        LLOGE("Invalid parameter");
        return -1;
    }
    parameters->clear();
    reply.setDataPosition(0);
    std::vector<config_parameter> read;
    // Every step consumes a value or stops, so the loop ends with the data.
    while (true) {
        int32_t id = 0;
        if (reply.readInt32(&id) != NO_ERROR) {
            break;
        }
        if (id == kGroupEnd) {
            parameters->swap(read);
            return 0;
        }
        config_parameter parameter{id, {}};
        int32_t mark = 0;
        bool complete = false;
        while (reply.readInt32(&mark) == NO_ERROR) {
            // Any mark but 1 ends the parameter's values.
            if (mark != kValueFollows) {
                complete = true;
                break;
            }
            config_value value{0, 0};
            if ((keyed && reply.readInt32(&value.key) != NO_ERROR) ||
                reply.readInt32(&value.value) != NO_ERROR) {
                break;
            }
            parameter.values.push_back(value);
        }
        if (!complete) {
            break;
        }
        read.push_back(std::move(parameter));
    }
    LLOGE("Incomplete grouped reply: %zu of %zu bytes read", reply.dataPosition(), reply.dataSize());
    return -1;
}

} // namespace kelvo
