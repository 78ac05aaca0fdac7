// kestrelctl: plays the kernel factory driver for kestreld on a workstation. It sends command
// frames to the daemon's netlink port and prints, decoded, the frames the daemon sends back to
// the kernel's port.
#include <limits.h>
#include <math.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <time.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <functional>
#include <optional>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

#include "byte_order.h"
#include "capture.h"
#include "frame_codec.h"
#include "frame_decoder.h"
#include "kernel_frame.h"
#include "kernel_port.h"
#include "sensor_names.h"
#include "stream_plot.h"

namespace kestrelctl {
namespace {

constexpr int kExitOk = 0;
constexpr int kExitNoReply = 1;
constexpr int kExitUsage = 2;
constexpr int kExitChannel = 3;
constexpr int kExitFile = 4;

constexpr double kReplyTimeoutSeconds = 12.0;  // the daemon's 8 s wait, and some slack
constexpr double kBigdataTimeoutSeconds = 2.0;
constexpr double kStreamSeconds = 5.0;
constexpr size_t kBigdataMaxBytes = 256;

const char kHelp[] =
    R"(kestrelctl plays the kernel factory driver for kestreld: it sends command frames to the
daemon (netlink port 20000) and prints, decoded, the frames the daemon sends to the kernel's
port (KESTREL_KERNEL_PORT, default 100).

Usage: kestrelctl [--json] [--quiet] [--timeout SEC] [--pcap FILE] [--kernel-device PATH]
                  <command> [arguments]

Commands that wait for their reply (exit status 1 when it does not come in time):
  status <sensor>                 command 0; reply frame 0 (did the sensor answer)
  selftest <sensor>               command 8; reply frame 9 (accel, mag, pressure) or 14 (gyro)
  gyro-temp                       command 10; reply frame 10 (gyroscope temperature, deg C)
  stream <sensor> [--seconds N] [--csv FILE] [--plot FILE]
                                  command 1, then every sample (frame 2) for N seconds
                                  (default 5; Ctrl-C stops early), then command 3 and its
                                  reply frame 3
  mag fuserom|registers           command 11 or 12; reply frame 11 or 12
  lpf on|off                      command 15 or 16; reply frame 15 or 16
  dump <sensor>                   command 19; reply frame 20 (128 register bytes)
  calib read <sensor>             command 4; reply frame 5 (calibration from the registry)
  calib store <sensor> [--flag N] command 6 with the calibration flag (default 0); reply
                                  frame 7
  bigdata <command> <hex bytes>   bulk data for the light sensor: command 22-26, 28, 29, 31
                                  or 32 with sensor_type 4, the length and the bytes (at most
                                  256); 28 and 29 wait for frame 30, 31 and 32 for frame 33

Commands that only send (they leave the kernel's port free, so that a `kestrelctl listen`
in another terminal shows what the daemon answers):
  send <command> [word...]        one frame; the words are signed 32-bit, decimal or 0x hex
  raw <hex>                       the bytes as one datagram (spaces allowed)
  motor on|off                    command 17 or 18
  hh set <d_factor> <r> <g> <b> <c> <ct> <ct_offset> <th_high> <th_low>
                                  command 35: the light sensor's hidden-hole coefficients
                                  (sent with sensor_type 4)
  hh-perms                        command 36: fix the coefficient files' owner and mode
  diag stop|dump|states           command 27 with argument 1, 0 or 2

  listen [--count N] [--seconds S]
                                  print every frame the daemon sends, until N frames, S
                                  seconds or Ctrl-C

Captures:
  decode <file> [--csv FILE] [--plot FILE]
                                  print the protocol 23 frames of a netlink capture (from
                                  --pcap, or from tcpdump on a phone's nlmon interface), each
                                  with its time stamp (UTC) and direction, told by the sender's
                                  port id (20000 is the daemon); packets of other netlink
                                  protocols are skipped and counted. A capture that ends inside
                                  a packet, or holds a packet cut short, is exit status 4 after
                                  the frames before it.

Sensors: accel 0, gyro 1, mag 2, pressure 3, light 4, light-short 5, or any sensor_type
number (negative allowed; 0x hex too).

Options:
  --json         one JSON object a line for each frame:
                 {"type","name","len","pid","fields":{...},"payload":"<hex>"}
                 and {"sent":{...}} for each frame sent
  --quiet        while waiting for a reply, skip the frames that are not the reply (the
                 hidden-hole refresh, frame 34; samples of a stream left running). Without it
                 they are printed, marked [unrelated] ("unrelated":true in JSON).
  --pcap FILE    write every datagram sent and received, as it passes, to FILE: a pcap
                 capture of netlink protocol 23 (link type NETLINK, as tcpdump writes on
                 nlmon) that tshark and Wireshark open (tools/wireshark/ decodes its fields).
                 An existing capture is appended to, so a session's commands share a file.
  --kernel-device PATH  talk through the factory driver module's device (/dev/kestrel_factory)
                 to a daemon run with KESTREL_NETLINK_PROTOCOL=23 KESTREL_KERNEL_PORT=0
  --csv FILE     the samples of the stream (or of the capture) as CSV: time_s from the first
                 sample, then one column an axis in physical units (x_g, y_g, z_g)
  --plot FILE    the same drawn by gnuplot, PNG or SVG by the file's extension
  --timeout SEC  how long to wait for a reply. Default: 12 s (the daemon waits up to 8 s for
                 the sensor service before it replies) times KESTREL_TIME_SCALE, at least
                 1 s; bigdata 2 s times KESTREL_TIME_SCALE, at least 1 s.
  -h, --help     this text

Self-test verdicts: PASS/FAIL is read from word 1 of the reply (frames 9 and 14), the
sensor's own result word, which the daemon relays unchanged: 1 is PASS, anything else FAIL
(for the magnetometer the daemon writes -1 there when the sensor reports a failed test). A
reply sent after the daemon's own 8 s wait ran out holds the previous result.

Samples: accelerometer values are also shown in g (4096 counts a g), gyroscope values in
degrees per second (70 counts a degree per second) and magnetometer values in microtesla
(0.15 uT a count), as the daemon scales them; other sensors' values stay counts.

Exit status: 0 done (reply received), 1 no reply in time, 2 usage error, 3 the netlink
channel failed (port taken, no daemon), 4 a capture, CSV or plot file could not be read or
written.
)";

struct UsageError : std::runtime_error {
  using std::runtime_error::runtime_error;
};

struct Options {
  bool json = false;
  bool quiet = false;
  bool help = false;
  std::optional<double> timeout;
  std::optional<double> seconds;
  std::optional<long> count;
  std::optional<int32_t> flag;
  std::optional<std::string> pcap, csv, plot;
  std::vector<std::string> args;
};

volatile sig_atomic_t g_interrupted = 0;

void on_interrupt(int) {
  g_interrupted = 1;
}

// Ctrl-C ends a listen or a stream's sampling instead of the process (a stream still stops).
void catch_interrupts() {
  struct sigaction sa = {};
  sa.sa_handler = on_interrupt;
  sigemptyset(&sa.sa_mask);
  sa.sa_flags = 0;  // no SA_RESTART: the wait for frames returns at once
  sigaction(SIGINT, &sa, nullptr);
  sigaction(SIGTERM, &sa, nullptr);
}

using Clock = std::chrono::steady_clock;

// A deadline some seconds ahead (at most about four months, which no wait needs).
Clock::time_point after_seconds(double seconds) {
  return Clock::now() + std::chrono::duration_cast<Clock::duration>(
                            std::chrono::duration<double>(std::min(seconds, 1e7)));
}

// What is left until the deadline, as a poll timeout.
int milliseconds_until(Clock::time_point deadline) {
  const int64_t left =
      std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
  return static_cast<int>(std::min<int64_t>(std::max<int64_t>(left, 0), INT_MAX));
}

double time_scale() {
  const char* v = getenv("KESTREL_TIME_SCALE");
  if (v == nullptr || v[0] == '\0') return 1.0;
  char* end = nullptr;
  const double d = strtod(v, &end);
  return (end != v && *end == '\0' && d >= 0.0) ? d : 1.0;
}

double positive_seconds(const std::string& option, const std::string& text) {
  char* end = nullptr;
  const double d = strtod(text.c_str(), &end);
  if (text.empty() || *end != '\0' || !(d > 0.0) || !isfinite(d)) {
    throw UsageError(option + " needs a number of seconds above 0, not '" + text + "'");
  }
  return d;
}

Options parse_options(int argc, char** argv) {
  Options o;
  bool positional_only = false;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    if (positional_only || arg.size() < 2 || arg[0] != '-' || (arg[1] != '-' && arg != "-h")) {
      o.args.push_back(arg);  // negative numbers are arguments too
      continue;
    }
    if (arg == "--") {
      positional_only = true;
      continue;
    }
    std::string name = arg;
    std::optional<std::string> value;
    const size_t eq = arg.find('=');
    if (eq != std::string::npos) {
      name = arg.substr(0, eq);
      value = arg.substr(eq + 1);
    }
    auto take_value = [&]() {
      if (value) return *value;
      if (i + 1 >= argc) throw UsageError(name + " needs a value");
      return std::string(argv[++i]);
    };
    if (name == "-h" || name == "--help") {
      o.help = true;
    } else if (name == "--json" && !value) {
      o.json = true;
    } else if (name == "--quiet" && !value) {
      o.quiet = true;
    } else if (name == "--timeout") {
      o.timeout = positive_seconds(name, take_value());
    } else if (name == "--seconds") {
      o.seconds = positive_seconds(name, take_value());
    } else if (name == "--count") {
      const std::string v = take_value();
      int32_t n = 0;
      if (!parse_int32(v, &n) || n <= 0) throw UsageError("--count needs a number above 0");
      o.count = n;
    } else if (name == "--pcap") {
      o.pcap = take_value();
    } else if (name == "--kernel-device") {
      KernelPort::use_device(take_value());
    } else if (name == "--csv") {
      o.csv = take_value();
    } else if (name == "--plot") {
      o.plot = take_value();
      if (!StreamSamples::is_plot_path(*o.plot)) {
        throw UsageError("--plot draws a .png or a .svg file, not '" + *o.plot + "'");
      }
    } else if (name == "--flag") {
      int32_t n = 0;
      if (!parse_int32(take_value(), &n)) throw UsageError("--flag needs a 32-bit number");
      o.flag = n;
    } else {
      throw UsageError("unknown option " + arg);
    }
  }
  return o;
}

int32_t sensor_argument(const std::string& text) {
  int32_t sensor_type = 0;
  if (!parse_sensor(text, &sensor_type)) {
    throw UsageError("'" + text +
                     "' is no sensor: use accel, gyro, mag, pressure, light, light-short or a "
                     "sensor_type number");
  }
  return sensor_type;
}

int32_t number_argument(const std::string& what, const std::string& text) {
  int32_t v = 0;
  if (!parse_int32(text, &v)) {
    throw UsageError(what + " '" + text + "' is not a signed 32-bit number");
  }
  return v;
}

class Ctl {
 public:
  explicit Ctl(Options options) : o_(std::move(options)) {}

  int run();

 private:
  int dispatch();
  using Match = std::function<bool(const Frame&)>;

  void expect_arguments(size_t count, const char* usage) const;
  void only_options(const std::set<std::string>& allowed) const;

  void out(const std::string& line);
  void note(const std::string& message);
  int channel_error(const std::string& message);
  void print_frame(const Frame& frame, bool unrelated);
  void print_sent(const std::vector<uint8_t>& datagram, bool raw = false);

  int send_only(const std::vector<uint8_t>& datagram, bool raw = false);
  int send_and_wait(const std::vector<uint8_t>& datagram, const std::set<uint16_t>& reply_types,
                    double timeout, const Match& is_reply = nullptr);
  int await(const Match& is_reply, const Match& is_related, double timeout,
            const std::string& what);
  double reply_timeout(double nominal) const;

  int status();
  int selftest();
  int stream();
  int dump();
  int calib();
  int bigdata();
  int hh();
  int listen();
  int decode();
  int write_samples(const StreamSamples& samples);

  Options o_;
  CaptureWriter capture_;
  KernelPort port_;
};

void Ctl::expect_arguments(size_t count, const char* usage) const {
  if (o_.args.size() != count + 1) throw UsageError(std::string("usage: kestrelctl ") + usage);
}

void Ctl::only_options(const std::set<std::string>& allowed) const {
  const std::string& command = o_.args[0];
  if (o_.seconds && allowed.count("--seconds") == 0) {
    throw UsageError("--seconds does not apply to " + command);
  }
  if (o_.count && allowed.count("--count") == 0) {
    throw UsageError("--count does not apply to " + command);
  }
  if (o_.flag && allowed.count("--flag") == 0) {
    throw UsageError("--flag does not apply to " + command);
  }
  if ((o_.csv || o_.plot) && allowed.count("--csv") == 0) {
    throw UsageError(std::string(o_.csv ? "--csv" : "--plot") + " does not apply to " + command);
  }
}

void Ctl::out(const std::string& text) {
  fputs(text.c_str(), stdout);
  fflush(stdout);
}

void Ctl::note(const std::string& message) {
  fprintf(stderr, "kestrelctl: %s\n", message.c_str());
}

int Ctl::channel_error(const std::string& message) {
  note(message);
  return kExitChannel;
}

void Ctl::print_frame(const Frame& frame, bool unrelated) {
  const DecodedFrame d = decode_frame(frame);
  out(o_.json ? format_json(d, unrelated) + "\n" : format_text(d, unrelated));
}

void Ctl::print_sent(const std::vector<uint8_t>& datagram, bool raw) {
  if (raw || datagram.size() < kFrameHeaderSize) {
    out(o_.json ? "{\"sent\":{\"size\":" + std::to_string(datagram.size()) +
                      ",\"bytes\":" + json_string(to_hex(datagram)) + "}}\n"
                : "sent " + std::to_string(datagram.size()) + " bytes: " + to_hex(datagram, " ") +
                      "\n");
    return;
  }
  const DecodedFrame d = decode_command(split_frames(datagram.data(), datagram.size()).at(0));
  out(o_.json ? "{\"sent\":" + format_json(d) + "}\n" : "sent " + format_text(d));
}

double Ctl::reply_timeout(double nominal) const {
  if (o_.timeout) return *o_.timeout;
  return std::max(1.0, nominal * time_scale());
}

int Ctl::send_only(const std::vector<uint8_t>& datagram, bool raw) {
  std::string error;
  if (!port_.open_unbound(&error) || !port_.send(datagram, &error)) return channel_error(error);
  print_sent(datagram, raw);
  return kExitOk;
}

int Ctl::send_and_wait(const std::vector<uint8_t>& datagram, const std::set<uint16_t>& types,
                       double timeout, const Match& is_reply) {
  std::string error;
  if (!port_.open_bound(kernel_port_from_environment(), &error) || !port_.send(datagram, &error)) {
    return channel_error(error);
  }
  print_sent(datagram);
  std::string what;
  for (const uint16_t t : types)
    what += (what.empty() ? "frame type " : " or ") + std::to_string(t);
  return await(
      [&](const Frame& f) {
        return !f.malformed && types.count(f.type) != 0 && (!is_reply || is_reply(f));
      },
      nullptr, timeout, what);
}

// Prints frames until the reply has come (exit 0) or the time is up (exit 1). Frames that are
// neither the reply nor related to the command are marked, or skipped with --quiet.
int Ctl::await(const Match& is_reply, const Match& is_related, double timeout,
               const std::string& what) {
  const Clock::time_point deadline = after_seconds(timeout);
  for (;;) {
    std::vector<Frame> frames;
    std::string error;
    switch (port_.receive(milliseconds_until(deadline), &frames, &error)) {
      case KernelPort::Wait::kTimeout: {
        char seconds[32];
        snprintf(seconds, sizeof seconds, "%g", timeout);
        note("no reply (" + what + ") from kestreld within " + seconds + " s");
        return kExitNoReply;
      }
      case KernelPort::Wait::kInterrupted:
        note("interrupted while waiting for the reply (" + what + ")");
        return kExitNoReply;
      case KernelPort::Wait::kOverrun:
        note("frames were lost: the receive queue overflowed");
        continue;
      case KernelPort::Wait::kError:
        return channel_error(error);
      case KernelPort::Wait::kFrames:
        break;
    }
    bool replied = false;
    for (const Frame& f : frames) {
      const bool reply = !replied && is_reply(f);
      const bool related = reply || (is_related && is_related(f));
      if (related || !o_.quiet) print_frame(f, !related);
      replied = replied || reply;
    }
    if (replied) return kExitOk;
  }
}

int Ctl::status() {
  expect_arguments(1, "status <sensor>");
  const int32_t sensor_type = sensor_argument(o_.args[1]);
  return send_and_wait(build_command(NETLINK_MESSAGE_GET_STATUS, {sensor_type}), {FRAME_STATUS},
                       reply_timeout(kReplyTimeoutSeconds));
}

int Ctl::selftest() {
  expect_arguments(1, "selftest <sensor>");
  const int32_t sensor_type = sensor_argument(o_.args[1]);
  const std::vector<uint8_t> frame = build_command(NETLINK_MESSAGE_SELFTEST, {sensor_type});
  const int32_t id = smgr_id_of(sensor_type);
  const double timeout = reply_timeout(kReplyTimeoutSeconds);
  // The gyroscope's reply is frame 14, or frame 10 when its last result was a temperature.
  if (id == 10) return send_and_wait(frame, {FRAME_GYRO_SELFTEST, FRAME_GYRO_TEMPERATURE}, timeout);
  if (id == 0 || id == 20 || id == 30) return send_and_wait(frame, {FRAME_SELFTEST}, timeout);
  const int r = send_only(frame);
  if (r == kExitOk) {
    note(
        "no reply expected: the daemon replies to self tests of the accel, gyro, mag and "
        "pressure sensor types only");
  }
  return r;
}

int Ctl::stream() {
  expect_arguments(1, "stream <sensor> [--seconds N]");
  const int32_t sensor_type = sensor_argument(o_.args[1]);
  const double seconds = o_.seconds.value_or(kStreamSeconds);
  std::string error;
  if (!port_.open_bound(kernel_port_from_environment(), &error)) return channel_error(error);
  catch_interrupts();
  const std::vector<uint8_t> start = build_command(NETLINK_MESSAGE_GET_RAW_DATA, {sensor_type});
  if (!port_.send(start, &error)) return channel_error(error);
  print_sent(start);

  auto is_sample = [](const Frame& f) { return !f.malformed && f.type == FRAME_SAMPLE; };
  StreamSamples samples;
  const Clock::time_point end = after_seconds(seconds);
  while (!g_interrupted && Clock::now() < end) {
    std::vector<Frame> frames;
    const KernelPort::Wait w = port_.receive(milliseconds_until(end), &frames, &error);
    if (w == KernelPort::Wait::kError) return channel_error(error);
    if (w == KernelPort::Wait::kOverrun) note("samples were lost: the receive queue overflowed");
    const struct timeval& t = port_.received_at();
    for (const Frame& f : frames) {
      if (is_sample(f) || !o_.quiet) print_frame(f, !is_sample(f));
      if (is_sample(f)) samples.add(f, t.tv_sec + t.tv_usec / 1e6);
    }
  }
  g_interrupted = 0;

  const std::vector<uint8_t> stop = build_command(NETLINK_MESSAGE_STOP_RAW_DATA, {sensor_type});
  if (!port_.send(stop, &error)) return channel_error(error);
  print_sent(stop);
  // Samples still on their way belong to the stream, in its CSV and plot too (await asks once
  // a frame whether it is related).
  auto late_sample = [&](const Frame& f) {
    if (!is_sample(f)) return false;
    const struct timeval& t = port_.received_at();
    samples.add(f, t.tv_sec + t.tv_usec / 1e6);
    return true;
  };
  const int r = await([](const Frame& f) { return !f.malformed && f.type == FRAME_STOP_RAW_DATA; },
                      late_sample, reply_timeout(kReplyTimeoutSeconds), "frame type 3");
  const int written = write_samples(samples);
  return r != kExitOk ? r : written;
}

int Ctl::write_samples(const StreamSamples& samples) {
  std::string error;
  if (samples.others() > 0) {
    note(std::to_string(samples.others()) +
         " samples of other sensors are left out of the CSV and the plot");
  }
  if (o_.csv && !samples.write_csv(*o_.csv, &error)) {
    note(error);
    return kExitFile;
  }
  if (o_.plot && !samples.write_plot(*o_.plot, &error)) {
    note(error);
    return kExitFile;
  }
  return kExitOk;
}

// The time stamp of a captured datagram, in text (UTC time of day) and in JSON (seconds).
std::string stamp(const struct timeval& time, bool json) {
  char buf[64];
  if (json) {
    snprintf(buf, sizeof buf, "%lld.%06ld", static_cast<long long>(time.tv_sec),
             static_cast<long>(time.tv_usec));
  } else {
    struct tm t;
    const time_t seconds = time.tv_sec;
    gmtime_r(&seconds, &t);
    snprintf(buf, sizeof buf, "%02d:%02d:%02d.%06ld", t.tm_hour, t.tm_min, t.tm_sec,
             static_cast<long>(time.tv_usec));
  }
  return buf;
}

int Ctl::decode() {
  expect_arguments(1, "decode <capture file> [--csv FILE] [--plot FILE]");
  CaptureReader reader;
  std::string error;
  if (!reader.open(o_.args[1], &error)) {
    note(error);
    return kExitFile;
  }
  StreamSamples samples;
  uint64_t frames = 0;
  uint64_t foreign = 0;
  int status = kExitOk;
  for (;;) {
    CapturedPacket p;
    const CaptureReader::Next next = reader.next(&p, &error);
    if (next == CaptureReader::Next::kEnd) break;
    if (next == CaptureReader::Next::kError) {
      note(error);
      status = kExitFile;
      break;
    }
    if (p.arphrd != kArphrdNetlink || p.protocol != kCaptureProtocol) {
      ++foreign;
      continue;
    }
    if (p.datagram.size() < p.original_size) {
      note("packet " + std::to_string(p.number) +
           " is cut short: " + std::to_string(p.datagram.size()) + " of its " +
           std::to_string(p.original_size) + " bytes were captured (capture with tcpdump -s 0)");
      status = kExitFile;
      break;
    }
    for (const Frame& f : split_frames(p.datagram.data(), p.datagram.size())) {
      const DecodedFrame d = decode_by_sender(f);
      const std::string direction = d.command ? "to_daemon" : "from_daemon";
      if (o_.json) {
        out("{\"time\":" + stamp(p.time, true) + ",\"direction\":\"" + direction + "\"," +
            format_json(d).substr(1) + "\n");
      } else {
        out(stamp(p.time, false) + (d.command ? " kernel > daemon  " : " daemon > kernel  ") +
            format_text(d));
      }
      if (!d.command) samples.add(f, p.time.tv_sec + p.time.tv_usec / 1e6);
      ++frames;
    }
  }
  note(std::to_string(frames) + " frames of netlink protocol 23; " + std::to_string(foreign) +
       " packets of other protocols skipped");
  const int written = write_samples(samples);
  return status != kExitOk ? status : written;
}

int Ctl::dump() {
  expect_arguments(1, "dump <sensor>");
  const int32_t sensor_type = sensor_argument(o_.args[1]);
  const std::vector<uint8_t> frame = build_command(NETLINK_MESSAGE_DUMP_REGISTER, {sensor_type});
  if (sensor_type < 0 || sensor_type > 5) {
    const int r = send_only(frame);
    if (r == kExitOk) {
      note("no reply expected: the daemon dumps the registers of sensor types 0 to 5 only");
    }
    return r;
  }
  // A dump comes back with the sensor_type it was asked for as its index.
  return send_and_wait(
      frame, {FRAME_REGISTER_DUMP}, reply_timeout(kReplyTimeoutSeconds),
      [sensor_type](const Frame& f) { return !f.payload.empty() && f.payload[0] == sensor_type; });
}

int Ctl::calib() {
  if (o_.args.size() >= 2 && o_.args[1] == "read") {
    expect_arguments(2, "calib read <sensor>");
    return send_and_wait(
        build_command(NETLINK_MESSAGE_READ_CALIB_DATA, {sensor_argument(o_.args[2])}),
        {FRAME_CALIBRATION_REPORT}, reply_timeout(kReplyTimeoutSeconds));
  }
  if (o_.args.size() >= 2 && o_.args[1] == "store") {
    expect_arguments(2, "calib store <sensor> [--flag N]");
    return send_and_wait(build_command(NETLINK_MESSAGE_STORE_CALIB_DATA,
                                       {sensor_argument(o_.args[2]), o_.flag.value_or(0)}),
                         {FRAME_STORE_CALIBRATION}, reply_timeout(kReplyTimeoutSeconds));
  }
  throw UsageError("usage: kestrelctl calib read <sensor> | calib store <sensor> [--flag N]");
}

int Ctl::bigdata() {
  if (o_.args.size() < 3) throw UsageError("usage: kestrelctl bigdata <command> <hex bytes>");
  const int32_t command = number_argument("command", o_.args[1]);
  if (!is_bigdata_command(static_cast<uint32_t>(command)) || command < 0) {
    throw UsageError("command " + o_.args[1] +
                     " is no bulk-data command: use 22 to 26, 28, 29, 31 or 32");
  }
  std::string hex;
  for (size_t i = 2; i < o_.args.size(); ++i) hex += o_.args[i] + " ";
  std::vector<uint8_t> data;
  std::string error;
  if (!parse_hex(hex, &data, &error)) throw UsageError("bulk data: " + error);
  if (data.size() > kBigdataMaxBytes) {
    throw UsageError("bulk data of " + std::to_string(data.size()) +
                     " bytes: the driver takes at most 256 (send anything else with raw)");
  }
  const std::vector<uint8_t> frame =
      build_bigdata(static_cast<uint16_t>(command), kLightSensorType, data);
  // The light sensor's driver answers the threshold reads (28, 29) and the hd threshold reads
  // (31, 32); the other kinds have no data to answer with.
  const double timeout = reply_timeout(kBigdataTimeoutSeconds);
  if (command == 28 || command == 29) return send_and_wait(frame, {FRAME_THRESHOLD}, timeout);
  if (command == 31 || command == 32) return send_and_wait(frame, {FRAME_HD_THRESHOLD}, timeout);
  return send_only(frame);
}

int Ctl::hh() {
  if (o_.args.size() < 2 || o_.args[1] != "set") {
    throw UsageError(
        "usage: kestrelctl hh set <d_factor> <r> <g> <b> <c> <ct> <ct_offset> "
        "<th_high> <th_low>");
  }
  expect_arguments(10, "hh set <d_factor> <r> <g> <b> <c> <ct> <ct_offset> <th_high> <th_low>");
  static const char* const kNames[9] = {"d_factor", "r",         "g",       "b",     "c",
                                        "ct",       "ct_offset", "th_high", "th_low"};
  std::array<int32_t, 9> coefficients;
  for (size_t i = 0; i < 9; ++i) coefficients[i] = number_argument(kNames[i], o_.args[i + 2]);
  return send_only(build_hidden_hole(coefficients));
}

int Ctl::listen() {
  expect_arguments(0, "listen [--count N] [--seconds S]");
  std::string error;
  if (!port_.open_bound(kernel_port_from_environment(), &error)) return channel_error(error);
  catch_interrupts();
  std::optional<Clock::time_point> end;
  if (o_.seconds) end = after_seconds(*o_.seconds);
  long received = 0;
  while (!g_interrupted && (!end || Clock::now() < *end)) {
    std::vector<Frame> frames;
    const KernelPort::Wait w = port_.receive(end ? milliseconds_until(*end) : -1, &frames, &error);
    if (w == KernelPort::Wait::kError) return channel_error(error);
    if (w == KernelPort::Wait::kOverrun) note("frames were lost: the receive queue overflowed");
    for (const Frame& f : frames) {
      print_frame(f, false);
      if (o_.count && ++received >= *o_.count) return kExitOk;
    }
  }
  if (o_.count && o_.seconds && !g_interrupted) {
    char seconds[32];
    snprintf(seconds, sizeof seconds, "%g", *o_.seconds);
    note(std::to_string(received) + " of " + std::to_string(*o_.count) + " frames within " +
         seconds + " s");
    return kExitNoReply;
  }
  return kExitOk;
}

int Ctl::run() {
  if (o_.pcap && !o_.help && !o_.args.empty() && o_.args[0] != "decode") {
    std::string error;
    if (!capture_.open(*o_.pcap, &error)) {
      note(error);
      return kExitFile;
    }
    port_.tap(&capture_);
  }
  const int status = dispatch();
  if (!capture_.error().empty()) {
    note(capture_.error());
    return status != kExitOk ? status : kExitFile;
  }
  return status;
}

int Ctl::dispatch() {
  if (o_.help || (!o_.args.empty() && o_.args[0] == "help")) {
    out(kHelp);
    return kExitOk;
  }
  if (o_.args.empty()) throw UsageError("no command");
  const std::string& command = o_.args[0];
  const size_t n = o_.args.size();
  auto choice = [&](const char* usage, const char* a, const char* b, const char* c = nullptr) {
    expect_arguments(1, usage);
    const std::string& v = o_.args[1];
    if (v == a) return 0;
    if (v == b) return 1;
    if (c != nullptr && v == c) return 2;
    throw UsageError(std::string("usage: kestrelctl ") + usage);
  };

  if (command == "listen") {
    only_options({"--count", "--seconds"});
    return listen();
  }
  if (command == "stream") {
    only_options({"--seconds", "--csv"});
    return stream();
  }
  if (command == "decode") {
    only_options({"--csv"});
    if (o_.pcap) throw UsageError("--pcap does not apply to decode");
    return decode();
  }
  if (command == "calib") {
    only_options({"--flag"});
    if (o_.flag && (n < 2 || o_.args[1] != "store")) {
      throw UsageError("--flag applies to calib store only");
    }
    return calib();
  }
  only_options({});
  const double timeout = reply_timeout(kReplyTimeoutSeconds);
  if (command == "send") {
    if (n < 2) throw UsageError("usage: kestrelctl send <command> [word...]");
    const int32_t number = number_argument("command", o_.args[1]);
    if (number < 0 || number > 0xffff) {
      throw UsageError("command " + o_.args[1] + " does not fit the 16-bit nlmsg_type");
    }
    std::vector<int32_t> words;
    for (size_t i = 2; i < n; ++i) words.push_back(number_argument("word", o_.args[i]));
    return send_only(build_command(static_cast<uint16_t>(number), words));
  }
  if (command == "raw") {
    std::string hex;
    for (size_t i = 1; i < n; ++i) hex += o_.args[i] + " ";
    std::vector<uint8_t> bytes;
    std::string error;
    if (!parse_hex(hex, &bytes, &error)) throw UsageError("raw: " + error);
    if (bytes.empty()) throw UsageError("usage: kestrelctl raw <hex>");
    return send_only(bytes, true);
  }
  if (command == "status") return status();
  if (command == "selftest") return selftest();
  if (command == "gyro-temp") {
    expect_arguments(0, "gyro-temp");
    // Frame 10, or frame 14 when the gyroscope's last result was a self test.
    return send_and_wait(build_command(NETLINK_MESSAGE_GYRO_TEMPERATURE),
                         {FRAME_GYRO_TEMPERATURE, FRAME_GYRO_SELFTEST}, timeout);
  }
  if (command == "mag") {
    const bool registers = choice("mag fuserom|registers", "fuserom", "registers") == 1;
    return send_and_wait(build_command(registers ? NETLINK_MESSAGE_MAG_READ_REGISTERS
                                                 : NETLINK_MESSAGE_MAG_READ_FUSE_ROM),
                         {registers ? FRAME_MAG_REGISTERS : FRAME_MAG_FUSE_ROM}, timeout);
  }
  if (command == "lpf") {
    const bool off = choice("lpf on|off", "on", "off") == 1;
    // The reply's type follows the filter state the sensor reports, not the command.
    return send_and_wait(
        build_command(off ? NETLINK_MESSAGE_ACCEL_LPF_OFF : NETLINK_MESSAGE_ACCEL_LPF_ON),
        {FRAME_ACCEL_LPF_ON, FRAME_ACCEL_LPF_OFF}, timeout);
  }
  if (command == "motor") {
    const bool off = choice("motor on|off", "on", "off") == 1;
    return send_only(build_command(off ? NETLINK_MESSAGE_ACCEL_MOTOR_DISABLE
                                       : NETLINK_MESSAGE_ACCEL_MOTOR_ENABLE));
  }
  if (command == "dump") return dump();
  if (command == "bigdata") return bigdata();
  if (command == "hh") return hh();
  if (command == "hh-perms") {
    expect_arguments(0, "hh-perms");
    return send_only(build_command(NETLINK_MESSAGE_HH_FILE_PERMISSIONS));
  }
  if (command == "diag") {
    static const int32_t kArgument[3] = {1, 0, 2};
    const int action = choice("diag stop|dump|states", "stop", "dump", "states");
    return send_only(build_command(NETLINK_MESSAGE_DIAG_LOGGING, {0, kArgument[action]}));
  }
  throw UsageError("unknown command '" + command + "'");
}

}  // namespace
}  // namespace kestrelctl

int main(int argc, char** argv) {
  try {
    kestrelctl::Ctl ctl(kestrelctl::parse_options(argc, argv));
    return ctl.run();
  } catch (const kestrelctl::UsageError& e) {
    fprintf(stderr, "kestrelctl: %s\nRun 'kestrelctl --help' for the commands.\n", e.what());
    return kestrelctl::kExitUsage;
  }
}
