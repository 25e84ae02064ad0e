/*
 * tr_writer.cpp - record lines and the trace file: the line prefix (UTC
 * time, pid.thread id, component, identifier), the lazily opened trace file,
 * and the one write() that puts a whole line into it.
 *
 * The file is opened with O_APPEND so that each line, written by a single
 * write(), lands whole after every earlier one, whichever thread or process
 * writes it. The descriptor is one atomic integer: racing first records may
 * each open the file, one wins the swap and the others close theirs, and no
 * record ever waits for a lock (a lock held across fork would hang the child).
 */
#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>

#include "tr_internal.h"

namespace {

constexpr int kNotOpened = -1;
constexpr int kOpenFailed = -2;
/* A signal storm must not keep a record in the loop for ever. */
constexpr int kMaximumInterruptedRetries = 100;

std::atomic<int> Trace_File_Descriptor{kNotOpened};
std::atomic<uint64_t> Total_Lost_Records{0};

/* Returns the new descriptor, or kOpenFailed. */
int open_trace_file(const tr_i_settings_t &settings) {
  if (settings.trace_file_path == "-") {
    return STDERR_FILENO;
  }
  const char *p_path = settings.trace_file_path.c_str();
  char default_path[64];
  if (settings.trace_file_path.empty()) {
    std::snprintf(default_path, sizeof(default_path), "/tmp/qv_trace.%ld.log",
                  static_cast<long>(getpid()));
    p_path = default_path;
  }
  for (int attempt = 0; attempt < kMaximumInterruptedRetries; ++attempt) {
    const int descriptor = open(p_path, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    if (descriptor >= 0) {
      return descriptor;
    }
    if (errno != EINTR) {
      break;
    }
  }
  return kOpenFailed;
}

void close_unless_standard_error(int descriptor) {
  if (descriptor >= 0 && descriptor != STDERR_FILENO) {
    close(descriptor);
  }
}

/* The descriptor to write to, opening the file on first use; negative when
 * the file cannot be opened. */
int trace_file() {
  int descriptor = Trace_File_Descriptor.load(std::memory_order_acquire);
  if (descriptor != kNotOpened) {
    return descriptor;
  }
  const int opened = open_trace_file(tr_i_current_settings());
  if (Trace_File_Descriptor.compare_exchange_strong(descriptor, opened, std::memory_order_acq_rel,
                                                    std::memory_order_acquire)) {
    return opened;
  }
  close_unless_standard_error(opened);
  return descriptor;
}

/* One write() puts the line down; only when a signal or a full disk cuts it
 * short is the rest written after, so the tail is not lost. */
bool write_whole(int descriptor, const char *p_bytes, std::size_t length) {
  int interrupted = 0;
  while (length > 0) {
    const ssize_t written = write(descriptor, p_bytes, length);
    if (written > 0) {
      p_bytes += written;
      length -= static_cast<std::size_t>(written);
    } else if (written < 0 && errno == EINTR && ++interrupted < kMaximumInterruptedRetries) {
      continue;
    } else {
      return false;
    }
  }
  return true;
}

}  // namespace

void tr_i_begin_line(tr_i_line_t *p_line, const char *p_component, uint32_t id) {
  struct timespec now;
  clock_gettime(CLOCK_REALTIME, &now);
  struct tm utc;
  gmtime_r(&now.tv_sec, &utc);

  /* One byte of the prefix area stays free for the blank before the payload. */
  tr_i_text_t prefix{p_line->data, TR_I_PREFIX_CAPACITY - 1, 0, false};
  char formatted[96];
  int length =
      std::snprintf(formatted, sizeof(formatted), "%04d-%02d-%02dT%02d:%02d:%02d.%06ldZ %ld.%ld ",
                    utc.tm_year + 1900, utc.tm_mon + 1, utc.tm_mday, utc.tm_hour, utc.tm_min,
                    utc.tm_sec, static_cast<long>(now.tv_nsec / 1000), static_cast<long>(getpid()),
                    static_cast<long>(gettid()));
  tr_i_text_append(&prefix, formatted, static_cast<std::size_t>(length));

  tr_i_text_t component{p_line->data + prefix.length, TR_I_MAX_COMPONENT_BYTES, 0, false};
  tr_i_text_append_escaped(&component, p_component, std::strlen(p_component), false, true);
  if (component.truncated) {
    tr_i_text_drop_incomplete_character(&component);
  }
  prefix.length += component.length;

  length = std::snprintf(formatted, sizeof(formatted), " %u", id);
  tr_i_text_append(&prefix, formatted, static_cast<std::size_t>(length));

  p_line->prefix_length = prefix.length;
  p_line->payload = tr_i_text_t{p_line->data + prefix.length + 1, TR_MAX_PAYLOAD_BYTES, 0, false};
}

int32_t tr_i_write_line(tr_i_line_t *p_line) {
  tr_i_text_t &payload = p_line->payload;
  std::size_t end = p_line->prefix_length;
  if (payload.length > 0 || payload.truncated) {
    if (payload.truncated) {
      tr_i_text_drop_incomplete_character(&payload);
      std::memcpy(payload.p_data + payload.length, TR_I_TRUNCATION_MARKER,
                  sizeof(TR_I_TRUNCATION_MARKER) - 1);
      payload.length += sizeof(TR_I_TRUNCATION_MARKER) - 1;
    }
    p_line->data[end] = ' ';
    end += 1 + payload.length;
  }
  p_line->data[end++] = '\n';

  const int descriptor = trace_file();
  if (descriptor < 0 || !write_whole(descriptor, p_line->data, end)) {
    Total_Lost_Records.fetch_add(1, std::memory_order_relaxed);
    return TR_RESULT_WRITE_FAILED;
  }
  return TR_RESULT_OK;
}

int tr_i_trace_file_descriptor() {
  const int descriptor = Trace_File_Descriptor.load(std::memory_order_acquire);
  return descriptor >= 0 ? descriptor : -1;
}

void tr_i_close_trace_file() {
  close_unless_standard_error(
      Trace_File_Descriptor.exchange(kNotOpened, std::memory_order_acq_rel));
}

uint64_t tr_i_total_lost_records() {
  return Total_Lost_Records.load(std::memory_order_relaxed);
}
