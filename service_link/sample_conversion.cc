// Placeholder until the conversions land.
#include "sample_conversion.h"

void convert_sample(uint8_t, uint8_t, int32_t, int32_t, int32_t, const mag_sensitivity_values&,
                    sample_frame* frame) {
  *frame = sample_frame{};
}

int16_t to_frame_value(double) { return 0; }
