#include <zendrel/zendrel.h>

#include <fcntl.h>
#include <json/json.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "kelvo/RootPath.h"
#include "kelvo/ZendrelHost.h"

struct zendrel_eventobj {
    uint32_t id = 0;
    Json::Value params{Json::objectValue};
    Json::Value dynamicPaths{Json::arrayValue};
};

namespace {

struct Failures {
    std::mutex lock;
    std::set<std::pair<int, uint32_t>> calls;
};

Failures& failures() {
    static Failures* f = new Failures();
    return *f;
}

std::atomic<int32_t> gLiveObjects{0};

bool failing(kelvo::ZendrelHost::Call call, uint32_t id) {
    Failures& f = failures();
    std::lock_guard<std::mutex> guard(f.lock);
    return f.calls.count({call, id}) != 0;
}

Json::Value toJson(const zendrel_eventobj& obj) {
    Json::Value child(Json::objectValue);
    child["class"] = Json::UInt(obj.id);
    child["params"] = obj.params;
    if (!obj.dynamicPaths.empty()) {
        child["dynamic_paths"] = obj.dynamicPaths;
    }
    return child;
}

std::string key(uint16_t param) {
    return std::to_string(param);
}

void makeParents(const std::string& path) {
    for (size_t pos = path.find('/', 1); pos != std::string::npos; pos = path.find('/', pos + 1)) {
        mkdir(path.substr(0, pos).c_str(), 0775);
    }
}

} // namespace

zendrel_eventobj* zendrel_create_eventobj(uint32_t id) {
    if (failing(kelvo::ZendrelHost::CALL_CREATE, id)) {
        return nullptr;
    }
    zendrel_eventobj* obj = new zendrel_eventobj();
    obj->id = id;
    gLiveObjects++;
    return obj;
}

void zendrel_destroy_eventobj(zendrel_eventobj* obj) {
    if (obj != nullptr) {
        gLiveObjects--;
        delete obj;
    }
}

int zendrel_set_param(zendrel_eventobj* obj, uint16_t param, int64_t value) {
    if (obj == nullptr || failing(kelvo::ZendrelHost::CALL_SET_PARAM, obj->id)) {
        return -1;
    }
    obj->params[key(param)] = Json::Int64(value);
    return 0;
}

int zendrel_set_param(zendrel_eventobj* obj, uint16_t param, const char* text) {
    if (obj == nullptr || text == nullptr ||
        failing(kelvo::ZendrelHost::CALL_SET_PARAM, obj->id)) {
        return -1;
    }
    obj->params[key(param)] = text;
    return 0;
}

int zendrel_set_param(zendrel_eventobj* obj, uint16_t param, const zendrel_eventobj* child) {
    if (obj == nullptr || child == nullptr ||
        failing(kelvo::ZendrelHost::CALL_SET_PARAM, obj->id)) {
        return -1;
    }
    obj->params[key(param)] = toJson(*child);
    return 0;
}

int zendrel_fill_array_param(zendrel_eventobj* obj, uint16_t param, const zendrel_eventobj* child) {
    if (obj == nullptr || child == nullptr ||
        failing(kelvo::ZendrelHost::CALL_FILL_ARRAY, obj->id)) {
        return -1;
    }
    Json::Value& array = obj->params[key(param)];
    if (!array.isArray()) {
        array = Json::Value(Json::arrayValue);
    }
    array.append(toJson(*child));
    return 0;
}

int zendrel_add_and_del_dynamic_path(zendrel_eventobj* obj, const char* path) {
    if (obj == nullptr || path == nullptr ||
        failing(kelvo::ZendrelHost::CALL_DYNAMIC_PATH, obj->id)) {
        return -1;
    }
    obj->dynamicPaths.append(path);
    return 0;
}

int zendrel_send_event(zendrel_eventobj* obj) {
    if (obj == nullptr || failing(kelvo::ZendrelHost::CALL_SEND, obj->id)) {
        return -1;
    }
    Json::Value event(Json::objectValue);
    event["event"] = Json::UInt(obj->id);
    event["params"] = obj->params;
    if (!obj->dynamicPaths.empty()) {
        event["dynamic_paths"] = obj->dynamicPaths;
    }
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    std::string line = Json::writeString(builder, event) + "\n";

    static std::mutex* lock = new std::mutex();
    std::string path = kelvo::RootPath::resolve(KELVO_ZENDREL_EVENTS_FILE);
    std::lock_guard<std::mutex> guard(*lock);
    int fd = open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644);
    if (fd < 0) {
        makeParents(path);
        fd = open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644);
        if (fd < 0) {
            return -1;
        }
    }
    ssize_t n = write(fd, line.data(), line.size());
    close(fd);
    return n == static_cast<ssize_t>(line.size()) ? 0 : -1;
}

namespace kelvo {

void ZendrelHost::failCall(Call call, uint32_t id) {
    Failures& f = failures();
    std::lock_guard<std::mutex> guard(f.lock);
    f.calls.insert({call, id});
}

void ZendrelHost::clearFailures() {
    Failures& f = failures();
    std::lock_guard<std::mutex> guard(f.lock);
    f.calls.clear();
}

int32_t ZendrelHost::liveObjects() {
    return gLiveObjects.load();
}

} // namespace kelvo
