// MSP statistics field table: keys 4096 to 4168 and 8193 to 8214, each with
// its name and element count. Generated once from the controller's field
// list; edit by hand with care.
#include "parsers/msp_table.h"

#include <array>

namespace parsers {
namespace {

constexpr MspField kMspFields[] = {
    {4096, "passWithTmodeHard", 1},
    {4097, "passWithTmodeFS1_2b", 1},
    {4098, "passWithTmodeFS1_4b", 1},
    {4099, "passWithTmodeHard_fast", 1},
    {4100, "passWithTmodeFS1_2b_fast", 1},
    {4101, "passWithTmodeFS1_4b_fast", 1},
    {4102, "numOfCwFailedInTmodeFS2_EOL", 1},
    {4103, "numOfCwFailedInTmodeFS2_DSP_EOL", 1},
    {4104, "readAlgoPassWithHardAfterAcq", 1},
    {4105, "firstReadWasHardWithDefaultBDBFastRead", 1},
    {4106, "readalgoPassWithDS1", 1},
    {4107, "readalgoPassWithDYCE1", 1},
    {4108, "readalgoPassWithDS2", 1},
    {4109, "readalgoPassWithDYCE2", 1},
    {4110, "firstReadWasHardWithAcq", 1},
    {4111, "bdbDynamicMovedToEOL_LSB", 1},
    {4112, "bdbDynamicMovedToEOL_MSB", 1},
    {4113, "bdbDynamicMovedToEOL_USB", 1},
    {4114, "bdbDynamicMovedToSOL_LSB", 1},
    {4115, "bdbDynamicMovedToSOL_MSB", 1},
    {4116, "bdbDynamicMovedToSOL_USB", 1},
    {4117, "firstReadWasHardWithDefaultBDB", 1},
    {4118, "readAlgoPassedThroughSyndSumAcquisition", 1},
    {4119, "readAlgoPassedThroughSlip", 1},
    {4120, "FS2decodedBitFlips", 11},
    {4121, "slipTrackingAfterFs1ForceFailChangedVthInTicksHist", 4},
    {4122, "readAlgoPassWithFS2_4b_fast", 1},
    {4123, "readAlgoPassWithHardAfterSlip_fast", 1},
    {4124, "readAlgoPassWithFS12BitAfterSlip_fast", 1},
    {4125, "readAlgoPassWithFS14BitAfterSlip_fast", 1},
    {4126, "readAlgoPassWithFS3_fast", 1},
    {4127, "deepSoft1Decoded", 10},
    {4128, "deepSoft2Decoded", 10},
    {4129, "readAlgoPassedThroughFS2_2b_fast", 1},
    {4130, "readAlgoPassedThroughFS2_4b_fast", 1},
    {4131, "readAlgoPassedThroughSlip_fast", 1},
    {4132, "readAlgoPassedThroughFS3_fast", 1},
    {4133, "readalgoPassWithEXH", 1},
    {4134, "FS1decodedbitflips", 11},
    {4135, "readZeroPage", 1},
    {4136, "readErasedPage", 1},
    {4137, "readFail", 1},
    {4138, "numOfSensesWereSentDuringSyndSumAcq", 5},
    {4139, "numOfSensesWereSentDuringMiniAcq", 3},
    {4140, "bdbDefaultMoveFastToNormal", 1},
    {4141, "bdbDefaultMoveNormalToFast", 1},
    {4142, "readalgoPassWithEXH_DSP", 1},
    {4143, "readalgoPassWithDS1_DSP", 1},
    {4144, "readalgoPassWithDYCE1_DSP", 1},
    {4145, "firstReadWasFS2EOL_DSP", 1},
    {4146, "firstReadWasFS2EOL", 1},
    {4147, "readAlgoPassedThroughFS2_4b", 1},
    {4148, "readAlgoPassWithFS2_4b", 1},
    {4149, "readAlgoPassedThroughFS2_2b", 1},
    {4150, "readAlgoPassedThroughFS3", 1},
    {4151, "readAlgoPassedThroughDS1", 1},
    {4152, "readAlgoPassedThroughDS2", 1},
    {4153, "readAlgoPassWithHardAfterSlip", 1},
    {4154, "readAlgoPassWithFS12BitAfterSlip", 1},
    {4155, "readAlgoPassWithFS14BitAfterSlip", 1},
    {4156, "readAlgoPassWithFS3", 1},
    {4157, "readAlgoPassedThroughSyndSumAcquisition_DSP", 1},
    {4158, "readAlgoPassWithFS12BitAfterAcq", 1},
    {4159, "readAlgoPassWithFS14BitAfterAcq", 1},
    {4160, "readAlgoPassedThroughDS1_DSP", 1},
    {4161, "numOfSlipTracking", 1},
    {4162, "bdbDynamicMovedToEOL_QSB", 1},
    {4163, "bdbDynamicMovedToSOL_QSB", 1},
    {4164, "syndSumAcqConvergedToStaticWalls", 1},
    {4165, "DYCE1_Decoded_Bitflips", 15},
    {4166, "DYCE1_Target_Bitflips", 20},
    {4167, "DYCE2_Decoded_Bitflips", 15},
    {4168, "DYCE2_Target_Bitflips", 20},
    {8193, "avg_rd_window_size", 5},
    {8194, "num_zq_failures", 1},
    {8195, "lower_die_temperature", 16},
    {8196, "higher_die_temperature", 16},
    {8197, "number_of_sram_flips", 1},
    {8198, "number_of_reset_failures", 1},
    {8199, "device_config", 1},
    {8200, "number_of_throttling_events", 1},
    {8201, "link_speed_recoveries", 1},
    {8202, "fw_updates", 1},
    {8203, "maintenance_backup_to_main", 1},
    {8204, "maintenance_main_to_backup", 1},
    {8205, "boot_block_program_failures", 1},
    {8206, "boot_block_erase_failures", 1},
    {8207, "boot_block_read_verify_failures", 1},
    {8208, "boot_block_read_failures", 1},
    {8209, "boot_block_refresh", 1},
    {8210, "boot_block_convert_to_main", 1},
    {8211, "boot_block_read_source_changed", 1},
    {8212, "open_blocks_hist", 4},
    {8213, "random_read_hit_ratio_hist", 6},
    {8214, "active_time_hist", 5},
};
static_assert(std::size(kMspFields) == 95);

// Keys 4096..4168 and 8193..8214 map to consecutive slots.
constexpr int Slot(uint32_t key) {
  if (key >= 4096 && key <= 4168) return static_cast<int>(key - 4096);
  if (key >= 8193 && key <= 8214) return static_cast<int>(key - 8193 + 73);
  return -1;
}
constexpr std::array<int16_t, 95> BuildIndex() {
  std::array<int16_t, 95> index{};
  for (auto& i : index) i = -1;
  for (size_t i = 0; i < std::size(kMspFields); ++i) index[Slot(kMspFields[i].key)] = static_cast<int16_t>(i);
  return index;
}
constexpr std::array<int16_t, 95> kIndex = BuildIndex();

}  // namespace

const MspField* FindMspField(uint32_t key) {
  const int slot = Slot(key);
  if (slot < 0 || kIndex[slot] < 0) return nullptr;
  return &kMspFields[kIndex[slot]];
}

std::span<const MspField> MspFields() { return kMspFields; }

}  // namespace parsers
