#include "platform/json_text.h"

#include <cmath>

void JsonTextSetup(JsonTextWriter &writer)
{
    writer.SetIndent(' ', 3);
}

void JsonWriteDouble(JsonTextWriter &writer, double value)
{
    if (std::isfinite(value))
        writer.Double(value);
    else
        writer.Null();
}

int JsonWrite(JsonTextWriter &writer, const Json::Value &value)
{
    switch (value.type()) {
    case Json::nullValue:
        return writer.Null() ? 0 : -1;
    case Json::intValue:
        return writer.Int64(value.asInt64()) ? 0 : -1;
    case Json::uintValue:
        return writer.Uint64(value.asUInt64()) ? 0 : -1;
    case Json::realValue:
        JsonWriteDouble(writer, value.asDouble());
        return 0;
    case Json::booleanValue:
        return writer.Bool(value.asBool()) ? 0 : -1;
    case Json::stringValue: {
        const char *begin = nullptr;
        const char *end = nullptr;
        if (!value.getString(&begin, &end))
            return writer.String("", 0) ? 0 : -1;
        return writer.String(begin, static_cast<rapidjson::SizeType>(end - begin)) ? 0 : -1;
    }
    case Json::arrayValue:
        writer.StartArray();
        for (const Json::Value &item : value)
            if (JsonWrite(writer, item) != 0)
                return -1;
        return writer.EndArray() ? 0 : -1;
    case Json::objectValue:
        writer.StartObject();
        for (Json::Value::const_iterator it = value.begin(); it != value.end(); ++it) {
            const char *end = nullptr;
            const char *name = it.memberName(&end);
            writer.Key(name, static_cast<rapidjson::SizeType>(end - name));
            if (JsonWrite(writer, *it) != 0)
                return -1;
        }
        return writer.EndObject() ? 0 : -1;
    }
    return -1;
}

std::string JsonText(const Json::Value &value)
{
    rapidjson::StringBuffer buffer;
    JsonTextWriter writer(buffer);
    JsonTextSetup(writer);
    JsonWrite(writer, value);
    std::string text(buffer.GetString(), buffer.GetSize());
    text += '\n';
    return text;
}
