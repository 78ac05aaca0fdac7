// The phone is 64-bit ARM. These checks run in every build (the workstation's, the arm64 one
// under qemu-user and the device's own test suite): the layout of every record the daemon
// exchanges with the kernel driver and the sensor service, the system records it builds frames
// in, and the sizes its allocation-failure lines report.
#include <android/log.h>
#include <gtest/gtest.h>
#include <linux/netlink.h>
#include <netinet/in.h>
#include <stddef.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/uio.h>

#include <mutex>
#include <string>
#include <vector>

#include "factory_results.h"
#include "kernel_channel/netlink_channel.h"
#include "kernel_frame.h"
#include "sensor1_messages.h"

namespace {

struct Field {
  const char* name;
  size_t actual;
  size_t expected;
};

#define FIELD(record, member, expected)                     \
  Field {                                                   \
#record "." #member, offsetof(record, member), expected \
  }
#define SIZE(record, expected)                  \
  Field {                                       \
    "sizeof " #record, sizeof(record), expected \
  }

void expect_layout(const std::vector<Field>& fields) {
  for (const Field& f : fields) EXPECT_EQ(f.actual, f.expected) << f.name;
}

TEST(AbiTest, SystemRecordsOfTheFramesHaveThe64BitLayout) {
  expect_layout({
      SIZE(struct nlmsghdr, 16),
      FIELD(struct nlmsghdr, nlmsg_len, 0),
      FIELD(struct nlmsghdr, nlmsg_type, 4),
      FIELD(struct nlmsghdr, nlmsg_flags, 6),
      FIELD(struct nlmsghdr, nlmsg_seq, 8),
      FIELD(struct nlmsghdr, nlmsg_pid, 12),
      SIZE(struct sockaddr_nl, 12),
      FIELD(struct sockaddr_nl, nl_family, 0),
      FIELD(struct sockaddr_nl, nl_pid, 4),
      FIELD(struct sockaddr_nl, nl_groups, 8),
      SIZE(struct msghdr, 56),
      FIELD(struct msghdr, msg_name, 0),
      FIELD(struct msghdr, msg_namelen, 8),
      FIELD(struct msghdr, msg_iov, 16),
      FIELD(struct msghdr, msg_iovlen, 24),
      FIELD(struct msghdr, msg_control, 32),
      FIELD(struct msghdr, msg_controllen, 40),
      FIELD(struct msghdr, msg_flags, 48),
      SIZE(struct iovec, 16),
      FIELD(struct iovec, iov_base, 0),
      FIELD(struct iovec, iov_len, 8),
      // The single-instance guard's address.
      SIZE(struct sockaddr_in, 16),
      FIELD(struct sockaddr_in, sin_family, 0),
      FIELD(struct sockaddr_in, sin_port, 2),
      FIELD(struct sockaddr_in, sin_addr, 4),
  });
}

TEST(AbiTest, KernelFramePayloadsHaveTheDriversLayout) {
  expect_layout({
      SIZE(status_reply, 2),
      FIELD(status_reply, sensor_type, 0),
      FIELD(status_reply, no_response, 1),
      SIZE(sample_frame, 16),
      FIELD(sample_frame, code, 0),
      FIELD(sample_frame, value, 4),
      SIZE(stop_reply, 8),
      FIELD(stop_reply, code, 0),
      FIELD(stop_reply, zero, 4),
      SIZE(calibration_report, 44),
      FIELD(calibration_report, pdata_sensor_type, 0),
      FIELD(calibration_report, word, 4),
      FIELD(calibration_report, result, 40),
      SIZE(store_calib_reply, 8),
      FIELD(store_calib_reply, pdata_sensor_type, 0),
      FIELD(store_calib_reply, result, 4),
      SIZE(selftest_reply, 72),
      SIZE(gyro_reply, 60),
      SIZE(mag_reply, 36),
      FIELD(mag_reply, code, 0),
      FIELD(mag_reply, fuse_rom, 4),
      FIELD(mag_reply, registers, 16),
      FIELD(mag_reply, zero, 30),
      FIELD(mag_reply, result, 32),
      SIZE(lpf_result, 12),
      FIELD(lpf_result, code, 0),
      FIELD(lpf_result, zero, 4),
      FIELD(lpf_result, lpf_on_off, 8),
      SIZE(register_dump_frame, 129),
      FIELD(register_dump_frame, index, 0),
      FIELD(register_dump_frame, registers, 1),
      SIZE(threshold_reply_frame, 16),
      FIELD(threshold_reply_frame, high, 0),
      FIELD(threshold_reply_frame, low, 4),
      FIELD(threshold_reply_frame, hd_high, 8),
      FIELD(threshold_reply_frame, hd_low, 12),
  });
}

TEST(AbiTest, SensorRequestsAndSharedResultsHaveTheirLayout) {
  expect_layout({
      SIZE(single_sensor_test_request, 12),
      FIELD(single_sensor_test_request, sensor_id, 0),
      FIELD(single_sensor_test_request, data_type, 1),
      FIELD(single_sensor_test_request, test_type, 4),
      FIELD(single_sensor_test_request, option, 8),
      SIZE(daf_request, 288),
      FIELD(daf_request, suid, 0),
      FIELD(daf_request, daf_request_id, 16),
      FIELD(daf_request, flag, 20),
      FIELD(daf_request, data_length, 24),
      FIELD(daf_request, data, 28),
      FIELD(daf_request, trailing_flag, 284),
      SIZE(factory_results, 156),
      FIELD(factory_results, accel_result, 0),
      FIELD(factory_results, gyro_result, 32),
      FIELD(factory_results, mag_result, 80),
      FIELD(factory_results, pressure_result, 144),
      FIELD(factory_results, test_status, 152),
      SIZE(mag_sensitivity_values, 12),
      FIELD(mag_sensitivity_values, x, 0),
      FIELD(mag_sensitivity_values, y, 4),
      FIELD(mag_sensitivity_values, z, 8),
  });
}

// The daemon's error lines, caught through liblog's logger hook. The phone's liblog hands the
// logger one message record; Debian's hands over the record's data and the text apart.
std::mutex g_mutex;
std::vector<std::string> g_errors;

void keep(int priority, const char* tag, const char* message) {
  if (priority != ANDROID_LOG_ERROR || tag == nullptr || strcmp(tag, "KESTRELD") != 0) return;
  std::lock_guard<std::mutex> lock(g_mutex);
  g_errors.push_back(message);
}

#if defined(__ANDROID__)
void capture(const struct __android_log_message* m) {
  keep(m->priority, m->tag, m->message);
}
void restore_logger() {
  __android_log_set_logger(__android_log_logd_logger);
}
#else
void capture(const struct __android_logger_data* d, const char* message) {
  keep(d->priority, d->tag, message);
}
void restore_logger() {
  __android_log_set_logger(__android_log_stderr_logger);
}
#endif

int g_fail_at = 0;
int g_calls = 0;
void* failing_malloc(size_t size) {
  return ++g_calls == g_fail_at ? nullptr : malloc(size);
}

TEST(AbiTest, AllocationFailureLinesShowTheSizesOfThe64BitRecords) {
  const char* const lines[] = {
      "failed on msgh netmgr_malloc: 56\n",
      "failed on nladdr netmgr_malloc: 12\n",
      "failed on iov netmgr_malloc: 16\n",
      "failed on buf netmgr_malloc: 20\n",
  };
  __android_log_set_logger(capture);
  for (int block = 1; block <= 4; ++block) {
    {
      std::lock_guard<std::mutex> lock(g_mutex);
      g_errors.clear();
    }
    g_fail_at = block;
    g_calls = 0;
    set_netmgr_malloc_for_testing(failing_malloc);
    struct msghdr* m = netmgr_nl_alloc_msg(20);
    set_netmgr_malloc_for_testing(nullptr);
    EXPECT_EQ(m, nullptr);
    std::lock_guard<std::mutex> lock(g_mutex);
    EXPECT_EQ(g_errors, std::vector<std::string>{lines[block - 1]}) << "block " << block;
  }
  restore_logger();
}

}  // namespace
