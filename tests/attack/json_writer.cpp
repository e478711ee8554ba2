// usage: zepa_json_writer PATH VALUE: writes {"value": VALUE} to PATH with the
// library's file writer; exit 0 when it reports success.
//        zepa_json_writer --kv PATH KEY VALUE: stores KEY=VALUE in the
// key/value file PATH with the system library's writer.
#include <zepasdk/kv.h>

#include <cstring>

#include <zeparelayd/config.h>

int main(int argc, char** argv) {
    if (argc == 5 && strcmp(argv[1], "--kv") == 0)
        return VLIBCFileSetKeyValue(argv[2], argv[3], argv[4]) == 0 ? 0 : 1;
    if (argc != 3) return 2;
    Json::Value value;
    value["value"] = argv[2];
    return ZEPA::Relay::RelaydConf::WriteJsonFile(argv[1], value) ? 0 : 1;
}
