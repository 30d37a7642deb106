// JSON text as the control replies and the files written by the system
// carry it: indented by three spaces, one member per line, object members
// in the order jsoncpp keeps them (sorted by name), UTF-8 written as it is
// (control characters escaped), numbers that are not finite written as
// null, a line feed at the end.
//
// The writer is RapidJSON's; JsonWrite feeds it a jsoncpp value, and code
// that writes a reply straight from its own data (a queue page) uses the
// same writer so that both texts look alike.
#ifndef TARN_JSON_TEXT_H
#define TARN_JSON_TEXT_H

#include <json/json.h>
#include <rapidjson/prettywriter.h>
#include <rapidjson/stringbuffer.h>

#include <cstddef>
#include <string>

typedef rapidjson::PrettyWriter<rapidjson::StringBuffer> JsonTextWriter;

// Sets the writer's indentation to that of every text (three spaces).
void JsonTextSetup(JsonTextWriter &writer);

// Writes value whole; 0, or -1 when the writer refused a step (the text is
// then incomplete).
int JsonWrite(JsonTextWriter &writer, const Json::Value &value);

// The text of value, with its final line feed.
std::string JsonText(const Json::Value &value);

// A double as the writer takes it: finite values as they are, others as
// null.
void JsonWriteDouble(JsonTextWriter &writer, double value);

#endif
