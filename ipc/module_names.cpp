// The product's module ids, which a peer puts in the upper 12 bits of its
// channel ids; only the trace reads them.
#include "ipc/trace.hpp"

#include <map>

namespace torvad {

namespace {
const std::map<std::uint32_t, const char*> module_names = {
    {0, "invalid"},       {1, "simple"},     {2, "consumer"},   {3, "producer"},
    {4, "ktlapi"},        {5, "psfile"},     {6, "stream"},     {7, "axisip"},
    {8, "syslog"},        {9, "script"},     {10, "event"},     {11, "groups"},
    {12, "notify"},       {13, "serial"},    {14, "pos"},       {15, "export"},
    {16, "ptz"},          {17, "iqeye"},     {18, "sony"},      {19, "evtlog"},
    {20, "sound"},        {21, "panasonic"}, {22, "acti"},      {23, "ipcamdetect"},
    {24, "arecont"},      {25, "vivotek"},   {26, "onvifnvc"},  {32, "softtrigger"},
    {33, "areconttftp"},  {34, "ioimage"},   {35, "stardot"},   {36, "bosch"},
    {37, "canon"},        {38, "ipx"},       {39, "stretch"},   {40, "basler"},
    {41, "ganz"},         {48, "torvartsp"}, {49, "sanyo"},     {50, "pelco"},
    {51, "http"},         {52, "brelume"},   {53, "hikvision"}, {54, "udp"},
    {55, "sysmgmt"},      {56, "update"},    {57, "archive"},   {64, "dahua"},
    {65, "samsung"},      {66, "pixelpro"},  {67, "usbdio"},    {68, "nwstorage"},
    {69, "brelume_flex"}, {70, "brelume_3"}, {71, "quenmar"},   {72, "videotest"},
    {73, "dahua_ip"},     {74, "dorvane"},   {75, "zarbel"},    {76, "discovery"},
    {77, "dynacolor"},    {78, "honeywell"}, {79, "sarvik"},    {80, "boschsec"},
    {81, "analytic"},     {82, "dmp"},       {83, "hexlock"},   {84, "failback"},
    {85, "rtsp_server"},  {86, "mornad"},    {87, "axisbw"},    {32768, "core"},
};
} // namespace

const char* module_name(std::uint32_t module_id) {
    auto row = module_names.find(module_id);
    return row == module_names.end() ? nullptr : row->second;
}

} // namespace torvad
