#include "BenchReport.h"

#include <ctime>

namespace mx::bench {

Dictionary benchReport(std::mt19937& random, int seq)
{
    static const char* routes[] = {"Speaker", "Headphones", "BluetoothA2DP", "CarPlay"};
    return Dictionary{
        {"sample_rate", (random() % 2) ? 48000 : 44100},
        {"route", routes[random() % 4]},
        {"buffer_frames", 512},
        {"underruns", static_cast<int>(random() % 3)},
        {"peak level", -12.5 + static_cast<double>(random() % 100) / 10.0},
        {"codec", "aac"},
        {"seq", seq},
        {"EngineOnTime", 1.5},
        {"mxreporting_timestamp", static_cast<std::int64_t>(std::time(nullptr))},
    };
}

mxr::Payload payloadOf(const Dictionary& dictionary)
{
    mxr::Payload payload;
    for (const auto& [key, value] : dictionary) {
        if (const std::int64_t* integer = value.asInt())
            payload.add(key.c_str(), *integer);
        else if (const double* real = value.asDouble())
            payload.add(key.c_str(), *real);
        else if (const std::string* text = value.asString())
            payload.add(key.c_str(), *text);
        else if (const bool* flag = value.asBool())
            payload.add(key.c_str(), *flag);
    }
    return payload;
}

void startBenchSession(mxr::Client& client, std::int64_t id)
{
    mxr::Payload configuration;
    configuration.add("HostApplicationDisplayID", "bench");
    client.createSession(id);
    client.setServiceType(id, 7);
    client.setConfiguration(id, configuration);
    client.startSession(id);
}

} // namespace mx::bench
