// usage: zepa_json_writer PATH VALUE: writes {"value": VALUE} to PATH with the
// library's file writer; exit 0 when it reports success.
#include <zeparelayd/config.h>

int main(int argc, char** argv) {
    if (argc != 3) return 2;
    Json::Value value;
    value["value"] = argv[2];
    return ZEPA::Relay::RelaydConf::WriteJsonFile(argv[1], value) ? 0 : 1;
}
