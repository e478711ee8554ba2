// The catalogue of services the relay can offer. The table is data: its
// spellings and masks are relied upon by the firewall name mapping and by the
// permission file, quirks included.
#include <zeparelayd/config.h>

#include "common/paths.h"

namespace ZEPA {
namespace Relay {

namespace {
// Absolute names; resolved against the system root where they are used.
constexpr const char* kInfo = Paths::ZEPAINFO_CONF;
constexpr const char* kSyncSetting = Paths::SYNC_SETTING_CONF;
constexpr uint32_t kAny = 0xFFFFFFFF;
}  // namespace

// clang-format off
const SupportService grgszSupportService[] = {
    {"nos",                        nullptr,      nullptr,         nullptr, 1, nullptr,       nullptr,             0x1},
    {"nos_https",                  kInfo,        "runHTTPS",      "yes",   0, nullptr,       nullptr,             0x1},
    {"webdav_http",                nullptr,      nullptr,         nullptr, 0, nullptr,       "webdav-httpd-pure", 0x1},
    {"webdavs_https",              nullptr,      nullptr,         nullptr, 0, nullptr,       "webdav-httpd-ssl",  0x1},
    {"http",                       nullptr,      nullptr,         nullptr, 0, nullptr,       nullptr,             kAny},
    {"https",                      kInfo,        "runWebHTTPS",   "yes",   0, nullptr,       nullptr,             kAny},
    {"telnet",                     kInfo,        "runtelnet",     "yes",   0, nullptr,       nullptr,             kAny},
    {"ssh",                        kInfo,        "supportssh",    "yes",   0, nullptr,       "ssh-shell",         kAny},
    // The management SPDY row carries the portal bit, the photo SPDY row the photo-portal bit.
    {"nos_https_spdy_30",          kInfo,        "runHTTPS",      "yes",   0, nullptr,       nullptr,             0x10},
    {"photo_https_spdy_30",        kInfo,        "runWebHTTPS",   "yes",   0, "PictureDock", nullptr,             0x20},
    // Spelled like the firewall's name of the management HTTPS service, on purpose.
    {"nso_https",                  kInfo,        "runHTTPS",      "yes",   0, nullptr,       nullptr,             0x8},
    {"file_sharing",               kInfo,        "runHTTPS",      "yes",   0, nullptr,       nullptr,             0x8},
    {"file_sharing_https",         kInfo,        "runHTTPS",      "yes",   0, nullptr,       nullptr,             0x8},
    {"nos_portal",                 kInfo,        "redirectHTTPS", "no",    1, nullptr,       nullptr,             0x10},
    {"nos_portal_https",           kInfo,        "runHTTPS",      "yes",   0, nullptr,       nullptr,             0x10},
    {"nos_portal_https_spdy_30",   kInfo,        "runHTTPS",      "yes",   0, nullptr,       nullptr,             0x10},
    {"photo_portal_http",          nullptr,      nullptr,         nullptr, 0, "PictureDock", nullptr,             0x20},
    {"photo_portal_https",         kInfo,        "runWebHTTPS",   "yes",   0, "PictureDock", nullptr,             0x20},
    {"photo_portal_https_spdy_30", kInfo,        "runWebHTTPS",   "yes",   0, "PictureDock", nullptr,             0x20},
    {"audio_http",                 nullptr,      nullptr,         nullptr, 1, "SoundDock",   nullptr,             0x1},
    {"audio_https",                kInfo,        "runHTTPS",      "yes",   0, "SoundDock",   nullptr,             0x1},
    {"photo_http",                 nullptr,      nullptr,         nullptr, 0, "PictureDock", nullptr,             0x2},
    {"photo_https",                kInfo,        "runWebHTTPS",   "yes",   0, "PictureDock", nullptr,             0x2},
    // The sync package names its file "setting.conf" (the photo package: "settings.conf").
    {"syncdock",                   kSyncSetting, "sydk_enable",   "1",     0, "SyncDock",    nullptr,             0x4},
    {nullptr,                      nullptr,      nullptr,         nullptr, 0, nullptr,       nullptr,             0},
};
// clang-format on

}  // namespace Relay
}  // namespace ZEPA
