// SPDX-License-Identifier: Apache-2.0
#include "stream_plot.h"

#include <errno.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <sys/wait.h>

#include "byte_order.h"
#include "frame_decoder.h"
#include "kernel_frame.h"
#include "sensor_names.h"

namespace kestrelctl {
namespace {

bool ends_with(const std::string& s, const char* suffix) {
  const size_t n = strlen(suffix);
  return s.size() >= n && s.compare(s.size() - n, n, suffix) == 0;
}

// A gnuplot string in single quotes, where a quote is written twice.
std::string quoted(const std::string& s) {
  std::string out = "'";
  for (const char c : s) out += (c == '\'') ? std::string("''") : std::string(1, c);
  return out + "'";
}

std::string value_text(int16_t count, double per_count) {
  char buf[32];
  if (per_count == 1.0) {
    snprintf(buf, sizeof buf, "%d", count);
  } else {
    snprintf(buf, sizeof buf, "%.6f", count * per_count);
  }
  return buf;
}

}  // namespace

void StreamSamples::add(const Frame& frame, double time) {
  if (frame.malformed || frame.type != FRAME_SAMPLE ||
      frame.payload.size() < sizeof(sample_frame)) {
    return;
  }
  const int32_t code = load_i32(frame.payload.data(), offsetof(sample_frame, code));
  if (samples_.empty()) code_ = code;
  if (code != code_) {
    ++others_;
    return;
  }
  Sample s{time, {}};
  for (size_t i = 0; i < 6; ++i) {
    s.values[i] = static_cast<int16_t>(load_u16(frame.payload.data(), 4 + 2 * i));
  }
  samples_.push_back(s);
}

bool StreamSamples::write_csv(const std::string& path, std::string* error) const {
  FILE* f = fopen(path.c_str(), "w");
  if (f == nullptr) {
    *error = "cannot write " + path + ": " + strerror(errno);
    return false;
  }
  const SampleScale scale = sample_scale(code_);
  std::string text = "time_s";
  for (size_t a = 0; a < scale.axes; ++a)
    text += "," + axis_name(scale.axes, a) + "_" + scale.ascii_unit;
  text += "\n";
  for (const Sample& s : samples_) {
    char time[32];
    snprintf(time, sizeof time, "%.6f", s.time - samples_.front().time);
    text += time;
    for (size_t a = 0; a < scale.axes; ++a) text += "," + value_text(s.values[a], scale.per_count);
    text += "\n";
  }
  const bool written = fputs(text.c_str(), f) >= 0;
  if (fclose(f) != 0 || !written) {
    *error = "cannot write " + path;
    return false;
  }
  return true;
}

bool StreamSamples::is_plot_path(const std::string& path) {
  return ends_with(path, ".png") || ends_with(path, ".svg");
}

bool StreamSamples::write_plot(const std::string& path, std::string* error) const {
  if (samples_.empty()) {
    *error = "no samples to plot in " + path;
    return false;
  }
  const SampleScale scale = sample_scale(code_);
  std::string script = "set encoding utf8\n";
  script += ends_with(path, ".svg") ? "set terminal svg size 1000,560 dynamic font 'sans,12'\n"
                                    : "set terminal pngcairo size 1000,560 font 'sans,11'\n";
  script += "set output " + quoted(path) + "\n";
  const double seconds = samples_.back().time - samples_.front().time;
  char title[128];
  snprintf(title, sizeof title, "%s stream (code %d): %zu samples in %.2f s",
           sensor_code_name(code_).c_str(), code_, samples_.size(), seconds);
  script += "set title " + quoted(title) + "\n";
  script += "set xlabel 'time (s)'\n";
  script += "set ylabel " + quoted(scale.quantity + " (" + scale.unit + ")") + "\n";
  script += "set grid\nset key outside right top\n$samples << EOD\n";
  for (const Sample& s : samples_) {
    char time[32];
    snprintf(time, sizeof time, "%.6f", s.time - samples_.front().time);
    script += time;
    for (size_t a = 0; a < scale.axes; ++a)
      script += " " + value_text(s.values[a], scale.per_count);
    script += "\n";
  }
  script += "EOD\nplot";
  for (size_t a = 0; a < scale.axes; ++a) {
    script += (a == 0 ? " $samples" : ", ''") + std::string(" using 1:") + std::to_string(a + 2) +
              " with lines linewidth 1.5 title " + quoted(axis_name(scale.axes, a));
  }
  script += "\n";

  FILE* gnuplot = popen("gnuplot", "w");
  if (gnuplot == nullptr) {
    *error = std::string("cannot run gnuplot: ") + strerror(errno);
    return false;
  }
  // Without gnuplot the shell ends at once: writing to it must not end this process.
  struct sigaction ignore = {};
  struct sigaction before = {};
  ignore.sa_handler = SIG_IGN;
  sigaction(SIGPIPE, &ignore, &before);
  fputs(script.c_str(), gnuplot);
  const int status = pclose(gnuplot);
  sigaction(SIGPIPE, &before, nullptr);
  if (status == -1 || !WIFEXITED(status) || WEXITSTATUS(status) != 0) {
    *error = WIFEXITED(status) && WEXITSTATUS(status) == 127
                 ? "cannot run gnuplot: install the gnuplot-nox package"
                 : "gnuplot could not draw " + path;
    return false;
  }
  return true;
}

}  // namespace kestrelctl
