#pragma once

#include <stddef.h>
#include <stdint.h>

namespace kelvo {

// The names under which the power-monitoring driver reports its IP blocks,
// and the ids the daemon stores them under. The driver and the daemon share
// this header so the two can never disagree on a name. Which table applies
// is the configuration's DPM data-source policy: 1 the base IP set, 2 the
// extended set with the DDR bandwidth levels.

struct dpm_ip_name {
    int32_t id;
    const char* name;
};

// A DDR bandwidth level: traffic at most `threshold` (flux per time unit)
// counts as the level's low-bandwidth pair, above it as the high pair.
struct dpm_ddr_level {
    int32_t id;
    const char* name;
    int64_t threshold;
};

// clang-format off
inline constexpr dpm_ip_name kDpmPolicy1Ips[] = {
    {0, "DSS"},            {1, "DDRC_CH0"},        {2, "DDRC_CH1"},      {3, "DDRC_CH2"},
    {4, "DDRC_CH3"},       {5, "MEM_SUBSYS"},      {6, "CPU_LITTLE"},    {7, "CPU_BIG"},
    {8, "GPU"},            {9, "AUDIO_DSP"},       {10, "AUDIO_BUS"},    {11, "AON_BUS"},
    {12, "SYS_BUS"},       {13, "LP_MCU"},         {14, "ISP"},          {15, "VDEC"},
    {16, "VENC"},          {17, "CFG_BUS"},        {18, "DMA_BUS"},      {19, "VISION_DSP"},
    {20, "VIVO_BUS"},      {21, "VCODEC_BUS"},     {22, "EMMC0_BUS"},    {23, "EMMC1_BUS"},
    {24, "DDR_AUTO_GATE"}, {25, "UFS_BUS"},        {26, "SENSORHUB_MCU"}, {27, "UFS"},
    {28, "LINK_STATE0"},   {29, "LINK_STATE1"},    {30, "LINK_STATE2"},  {31, "SPARE0"},
    {32, "DDR_BW"},
};

inline constexpr dpm_ip_name kDpmPolicy2Ips[] = {
    {32, "DDR_BW"},         {100, "DSS"},           {101, "SYS_BUS"},       {102, "LP_MCU"},
    {103, "ISP"},           {104, "VDEC"},          {105, "VENC"},          {106, "CFG_BUS"},
    {107, "DMA_BUS"},       {108, "VISION_DSP"},    {109, "VIVO_BUS"},      {110, "VCODEC_BUS"},
    {111, "DDR_AUTO_GATE"}, {112, "DDRC_CH0"},      {113, "DDRC_CH1"},      {114, "DDRC_CH2"},
    {115, "DDRC_CH3"},      {116, "MODEM_SUB0"},    {117, "MODEM_SUB1"},    {118, "MODEM_SUB2"},
    {119, "MODEM_SUB3"},    {120, "MODEM_SUB4"},    {121, "MODEM_SUB5"},    {122, "MODEM_SUB6"},
    {123, "MODEM_SUB7"},    {124, "MODEM_SUB8"},    {125, "MODEM_SUB9"},    {126, "MODEM_SUB10"},
    {127, "MODEM_SUB11"},   {128, "MODEM_SUB12"},   {129, "MODEM_SUB13"},   {130, "EMMC0_BUS"},
    {131, "EMMC1_BUS"},     {132, "LINK_STATE0"},   {133, "LINK_STATE1"},   {134, "LINK_STATE2"},
    {135, "CPU_LITTLE"},    {136, "CPU_BIG"},       {137, "GPU"},           {138, "SPARE0"},
    {139, "SPARE1"},        {140, "MEM_SUBSYS"},    {141, "AUDIO_SUB0"},    {142, "AUDIO_SUB1"},
    {143, "AUDIO_SUB2"},    {144, "AUDIO_SUB3"},    {145, "SENSORHUB_MCU"}, {146, "UFS_STAT"},
    {147, "SENSORHUB_MST"}, {148, "UFS_SUBSYS"},    {149, "SLEEP_STATE0"},  {150, "SLEEP_STATE1"},
    {151, "SLEEP_STATE2"},  {152, "LP_STATE0"},     {153, "LP_STATE1"},     {154, "LP_STATE2"},
    {155, "LP_STATE3"},     {156, "LP_STATE4"},
};
// clang-format on

// Policy 2 only; level i is "DDR_BW_FREQ_<i>".
inline constexpr dpm_ddr_level kDpmDdrLevels[] = {
    {10000, "DDR_BW_FREQ_0", 1000},
    {10001, "DDR_BW_FREQ_1", 1000},
    {10002, "DDR_BW_FREQ_2", 2000},
    {10003, "DDR_BW_FREQ_3", 2000},
};

inline constexpr size_t kDpmPolicy1IpCount = sizeof(kDpmPolicy1Ips) / sizeof(kDpmPolicy1Ips[0]);
inline constexpr size_t kDpmPolicy2IpCount = sizeof(kDpmPolicy2Ips) / sizeof(kDpmPolicy2Ips[0]);
inline constexpr size_t kDpmDdrLevelCount = sizeof(kDpmDdrLevels) / sizeof(kDpmDdrLevels[0]);
static_assert(kDpmPolicy1IpCount == 33, "policy 1 table");
static_assert(kDpmPolicy2IpCount == 58, "policy 2 table");

// The name prefix of the DDR bandwidth levels.
inline constexpr const char* kDpmDdrLevelPrefix = "DDR_BW_FREQ_";

}  // namespace kelvo
