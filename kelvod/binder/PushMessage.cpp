#include "binder/PushMessage.h"

#include <json/json.h>

#include <exception>
#include <memory>

#include "KelvoLog.h"

namespace kelvo {

namespace {

int32_t check(const std::string& message, std::string* extra) {
    Json::CharReaderBuilder builder;
    builder["collectComments"] = false;
    builder["stackLimit"] = PushMessage::kMaxDepth;
    builder["failIfExtra"] = true;
    builder["rejectDupKeys"] = true;
    std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    Json::Value root;
    std::string errors;
    if (!reader->parse(message.data(), message.data() + message.size(), &root, &errors) ||
        !root.isObject()) {
        return -5;
    }
    const Json::Value& transaction = root["transactionid"];
    const Json::Value& field = root["fieldid"];
    const Json::Value& extraValue = root["extra"];
    if (transaction.isArray() || transaction.isObject() || !field.isInt() ||
        !(extraValue.isNull() || extraValue.isString())) {
        return -5;
    }
    if (transaction.asString().empty()) {
        KLOGE("Failed to parse transaction id");
        return -4;
    }
    int32_t fieldId = field.asInt();
    if (fieldId != PushMessage::kSamplingFieldId) {
        KLOGE("Invalid field id: %d", fieldId);
        return -16;
    }
    *extra = extraValue.isString() ? extraValue.asString() : std::string();
    KLOGD("transaction=%s, filedid=%d, extra=%s", transaction.asString().c_str(), fieldId,
          extra->c_str());
    return 0;
}

}  // namespace

int32_t PushMessage::parse(const std::string& message, std::string* extra) {
    if (message.empty() || message.size() > kMaxMessageBytes || extra == nullptr) {
        return -5;
    }
    // The parser throws when the nesting goes past its limit.
    try {
        return check(message, extra);
    } catch (const std::exception&) {
        return -5;
    }
}

}  // namespace kelvo
