#include "connection.h"

#include <algorithm>
#include <cstring>
#include <new>

#include "gateway_impl.h"
#include "logging/logger.h"
#include "message_codec.h"
#include "pipe_support.h"

namespace parlo::ipc::impl {
namespace {

// Bytes asked for by each read.
constexpr DWORD read_chunk = 64 * 1024;
// Small frames are gathered into writes of up to this many bytes.
constexpr std::size_t write_chunk = 64 * 1024;
// A full delivery queue of the local bus is retried this often, this long
// apart, before the connection gives up.
constexpr int inject_attempts = 200;
constexpr DWORD inject_retry_ms = 10;

// How a connection ends when the peer just goes away: no error event.
bool peer_gone(DWORD err) {
  return err == ERROR_BROKEN_PIPE || err == ERROR_PIPE_NOT_CONNECTED || err == ERROR_NO_DATA ||
         err == ERROR_OPERATION_ABORTED;
}

// `message` with the origin blob set to `pid`, whatever the sender put under
// that name: only the receiving side knows who sent it. `why` tells what
// failed: the decoding (the sender broke the protocol) or, after it, the
// encoding (a message at the limits has no room for the blob).
enum class stamp_result { ok, undecodable, no_room };
stamp_result stamp_origin(const frame::message_view& message, std::uint32_t pid, std::vector<unsigned char>& out,
                          parlo::codec::status& why) {
  parlo::codec::message_content content;
  why = parlo::codec::decode(message.wire, message.wire_size, content);
  if (why != parlo::codec::status::ok) return stamp_result::undecodable;
  auto& fields = content.fields;
  fields.erase(std::remove_if(fields.begin(), fields.end(),
                              [](const parlo::codec::blob_field& f) { return f.name == origin_pid_blob; }),
               fields.end());
  fields.push_back(parlo::codec::blob_field{
      origin_pid_blob,
      {static_cast<unsigned char>(pid), static_cast<unsigned char>(pid >> 8), static_cast<unsigned char>(pid >> 16),
       static_cast<unsigned char>(pid >> 24)}});
  why = parlo::codec::encode(content, out);
  return why == parlo::codec::status::ok ? stamp_result::ok : stamp_result::no_room;
}

}  // namespace

// The write in flight: either one large frame written from its own buffer,
// or small frames copied into `staging`.
struct connection::write_state {
  std::vector<unsigned char> staging;
  frame_ptr large;
  const unsigned char* next = nullptr;
  std::size_t left = 0;
  std::size_t total = 0;  // bytes taken from the queue's count
  bool pending = false;   // a write is with the system
};

connection::connection(gateway_impl& gateway, winapi::unique_handle pipe,
                       const std::string& pipe_name, bool local)
    : gateway_(gateway),
      pipe_name_(pipe_name),
      local_(local),
      pipe_(std::move(pipe)),
      wake_event_(make_event(/* manual_reset */ false)) {}

const wchar_t* connection::log_name() const {
  return local_ ? L"parlo_ipc::server_connection::run" : L"parlo_ipc::client_connection::run";
}

void connection::enqueue(const frame_ptr& frame) {
  if (!frame) return;
  bool dropped = false;
  {
    std::lock_guard<srw_mutex> lock(mutex_);
    if (queue_closed_ || overflow_) return;
    if (queued_bytes_ + frame->size() > max_queued_bytes) {
      overflow_ = true;
      dropped = true;
    } else {
      queue_.push_back(frame);
      queued_bytes_ += frame->size();
    }
  }
  if (dropped) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::connection::enqueue")
        << L"pipe=" << pipe_name_ << L" handle=" << handle()
        << L": the peer does not read; more than " << max_queued_bytes
        << L" bytes would wait, the connection is dropped";
  }
  if (wake_event_) ::SetEvent(wake_event_.get());
}

void connection::close_queue() {
  std::lock_guard<srw_mutex> lock(mutex_);
  queue_closed_ = true;
  queue_.clear();
  queued_bytes_ = 0;
}

void connection::close_handle() {
  if (!pipe_) return;
  // Server side: the client sees its pipe broken at once. On a client's
  // handle the call fails harmlessly.
  if (local_) ::DisconnectNamedPipe(pipe_.get());
  pipe_.reset();
}

bool connection::take_write_locked(write_state& state) {
  if (queue_.empty()) return false;
  state.staging.clear();
  state.large.reset();
  if (queue_.front()->size() >= write_chunk) {
    state.large = std::move(queue_.front());
    queue_.pop_front();
    state.next = state.large->data();
    state.left = state.large->size();
  } else {
    while (!queue_.empty() && state.staging.size() + queue_.front()->size() <= write_chunk) {
      const std::vector<unsigned char>& bytes = *queue_.front();
      state.staging.insert(state.staging.end(), bytes.begin(), bytes.end());
      queue_.pop_front();
    }
    state.next = state.staging.data();
    state.left = state.staging.size();
  }
  state.total = state.left;
  return true;
}

void connection::raise_error(std::uint32_t err) {
  if (local_) {
    gateway_.raise_local_error(handle(), err);
  } else {
    gateway_.raise_remote_error(handle(), err);
  }
}

namespace {

// Starts an overlapped read or write. 0 when it is under way (or already
// done: its event is set either way), otherwise the Win32 code.
DWORD issue_read(HANDLE pipe, unsigned char* buffer, DWORD size, OVERLAPPED& ov) {
  if (::ReadFile(pipe, buffer, size, /* read */ nullptr, &ov)) return 0;
  const DWORD err = ::GetLastError();
  return err == ERROR_IO_PENDING ? 0 : err;
}

DWORD issue_write(HANDLE pipe, const unsigned char* bytes, std::size_t size, OVERLAPPED& ov) {
  const DWORD chunk = static_cast<DWORD>(std::min<std::size_t>(size, MAXDWORD));
  if (::WriteFile(pipe, bytes, chunk, /* written */ nullptr, &ov)) return 0;
  const DWORD err = ::GetLastError();
  return err == ERROR_IO_PENDING ? 0 : err;
}

}  // namespace

void connection::run() {
  winapi::unique_handle read_event = make_event(/* manual_reset */ true);
  const DWORD read_event_err = ::GetLastError();
  winapi::unique_handle write_event = make_event(/* manual_reset */ true);
  const DWORD write_event_err = ::GetLastError();
  std::vector<unsigned char> read_buffer;
  std::uint32_t failure = 0;  // why the loop ended; 0: the gateway stops
  bool report = false;        // whether `failure` is an error event
  try {
    read_buffer.resize(read_chunk);
  } catch (const std::bad_alloc&) {
    failure = ERROR_NOT_ENOUGH_MEMORY;
  }
  if (!usable()) failure = ERROR_NOT_ENOUGH_MEMORY;
  if (!read_event || !write_event) failure = !read_event ? read_event_err : write_event_err;
  report = failure != 0;

  OVERLAPPED read_ov{};
  read_ov.hEvent = read_event.get();
  OVERLAPPED write_ov{};
  write_ov.hEvent = write_event.get();
  write_state writing;
  bool read_pending = false;
  // Ends the loop: `code` 0 for a stop, a peer that went away gives no error
  // event, anything else does.
  auto end_with = [&](std::uint32_t code) {
    failure = code;
    report = code != 0 && !peer_gone(code);
  };

  try {
    while (failure == 0) {
      if (!read_pending) {
        if (const DWORD err = issue_read(handle(), read_buffer.data(), read_chunk, read_ov)) {
          end_with(err);
          break;
        }
        read_pending = true;
      }
      bool overflow = false;
      bool fresh = false;  // a new write to issue
      {
        std::lock_guard<srw_mutex> lock(mutex_);
        // Checked every round: a peer that does not read never completes
        // the write in flight.
        overflow = overflow_;
        if (!overflow && !writing.pending) fresh = take_write_locked(writing);
      }
      if (overflow) {
        end_with(ERROR_NOT_ENOUGH_QUOTA);
        break;
      }
      if (fresh) {
        if (const DWORD err = issue_write(handle(), writing.next, writing.left, write_ov)) {
          end_with(err);
          break;
        }
        writing.pending = true;
      }

      HANDLE waits[4] = {gateway_.stop_event(), wake_event_.get(), read_event.get(), nullptr};
      DWORD count = 3;
      if (writing.pending) waits[count++] = write_event.get();
      const DWORD woke = ::WaitForMultipleObjects(count, waits, /* wait_all */ FALSE, INFINITE);
      const DWORD wait_err = ::GetLastError();
      if (woke == WAIT_FAILED) {
        end_with(wait_err != 0 ? wait_err : ERROR_GEN_FAILURE);
        break;
      }
      if (woke == WAIT_OBJECT_0) break;  // the gateway stops

      if (read_pending && HasOverlappedIoCompleted(&read_ov)) {
        read_pending = false;
        DWORD got = 0;
        if (!::GetOverlappedResult(handle(), &read_ov, &got, /* wait */ FALSE)) {
          const DWORD err = ::GetLastError();
          end_with(err);
          break;
        }
        if (const std::uint32_t err = handle_read(read_buffer.data(), got)) {
          end_with(err);
          break;
        }
      }
      if (writing.pending && HasOverlappedIoCompleted(&write_ov)) {
        DWORD put = 0;
        if (!::GetOverlappedResult(handle(), &write_ov, &put, /* wait */ FALSE)) {
          const DWORD err = ::GetLastError();
          writing.pending = false;
          end_with(err);
          break;
        }
        const std::size_t done = std::min<std::size_t>(put, writing.left);
        writing.next += done;
        writing.left -= done;
        if (writing.left > 0) {
          // A short write: the rest goes at once, before anything else.
          if (const DWORD err = issue_write(handle(), writing.next, writing.left, write_ov)) {
            writing.pending = false;
            end_with(err);
            break;
          }
        } else {
          writing.pending = false;
          std::lock_guard<srw_mutex> lock(mutex_);
          queued_bytes_ -= std::min<std::uint64_t>(queued_bytes_, writing.total);
          writing.large.reset();
        }
      }
    }
  } catch (const std::bad_alloc&) {
    end_with(ERROR_NOT_ENOUGH_MEMORY);
  }

  // The buffers must outlive every operation the system still holds.
  if (read_pending || writing.pending) {
    ::CancelIoEx(handle(), /* overlapped */ nullptr);
    DWORD ignored = 0;
    if (read_pending) ::GetOverlappedResult(handle(), &read_ov, &ignored, /* wait */ TRUE);
    if (writing.pending) ::GetOverlappedResult(handle(), &write_ov, &ignored, /* wait */ TRUE);
  }
  close_queue();

  if (report) {
    logging::logger_stream(logging::level_error, log_name())
        << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" closed err=" << failure;
    raise_error(failure);
  } else {
    logging::logger_stream(logging::level_info, log_name())
        << L"pipe=" << pipe_name_ << L" handle=" << handle()
        << (failure == 0 ? L" closed: the gateway stops" : L" closed by the peer");
  }
}

std::uint32_t connection::handle_read(const unsigned char* data, std::size_t size) {
  while (size > 0) {
    const std::size_t used = reader_.feed(data, size);
    data += used;
    size -= used;
    if (reader_.failed()) {
      logging::logger_stream(logging::level_error, log_name())
          << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" bad frame ("
          << frame::status_text(reader_.state()) << L", length " << reader_.length() << L")";
      return ERROR_INVALID_DATA;
    }
    if (reader_.complete()) {
      const std::uint32_t err = handle_frame(reader_);
      reader_.next();
      if (err != 0) return err;
    }
  }
  return 0;
}

std::uint32_t connection::handle_frame(const frame::frame_reader& reader) {
  const std::vector<unsigned char>& payload = reader.payload();
  if (reader.type() == frame::frame_type::hello) {
    if (hello_seen_) {
      logging::logger_stream(logging::level_error, log_name())
          << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" a second hello";
      return ERROR_INVALID_DATA;
    }
    frame::hello hello;
    const frame::status decoded = frame::decode_hello(payload.data(), payload.size(), hello);
    if (decoded != frame::status::ok) {
      logging::logger_stream(logging::level_error, log_name())
          << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" bad hello ("
          << frame::status_text(decoded) << L")";
      return ERROR_INVALID_DATA;
    }
    if (const std::uint32_t err = on_hello(hello); err != 0) return err;
    hello_seen_ = true;
    if (local_) {
      gateway_.raise_local_start_communication(handle());
    } else {
      gateway_.raise_remote_start_communication(handle());
    }
    return 0;
  }
  if (!hello_seen_) {
    logging::logger_stream(logging::level_error, log_name())
        << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" a message before the hello";
    return ERROR_INVALID_DATA;
  }
  frame::message_view message;
  const frame::status decoded = frame::decode_message(payload.data(), payload.size(), message);
  if (decoded != frame::status::ok) {
    logging::logger_stream(logging::level_error, log_name())
        << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" bad message ("
        << frame::status_text(decoded) << L")";
    return ERROR_INVALID_DATA;
  }
  return on_message(message);
}

std::uint32_t connection::inject(const std::string& channel, const frame::message_view& message) {
  std::vector<unsigned char> stamped;
  parlo::codec::status why = parlo::codec::status::ok;
  const stamp_result stamp = stamp_origin(message, peer_pid_, stamped, why);
  if (stamp == stamp_result::no_room) {
    logging::logger_stream(logging::level_warning, log_name())
        << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" channel=" << channel
        << L": message dropped, no room for its origin (" << parlo::codec::status_text(why) << L")";
    return 0;
  }
  if (stamp == stamp_result::undecodable) {
    // The peer sent bytes that are not a message: it breaks the protocol.
    logging::logger_stream(logging::level_error, log_name())
        << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" channel=" << channel
        << L": undecodable message, err=" << parlo::error_invalid_data;
    return ERROR_INVALID_DATA;
  }
  const parlo_api& api = gateway_.api();
  for (int attempt = 0; attempt < inject_attempts; ++attempt) {
    const std::uint32_t result = api.inject(gateway_.bus(), channel.c_str(), stamped.data(), stamped.size());
    switch (result) {
      case 0:
        return 0;
      case parlo::error_invalid_data:
      case parlo::error_invalid_parameter:
        // The peer sent bytes that are not a message: it breaks the protocol.
        logging::logger_stream(logging::level_error, log_name())
            << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" channel=" << channel
            << L": undecodable message, err=" << result;
        return ERROR_INVALID_DATA;
      case parlo::error_not_enough_quota:
        // The bus is behind: wait for it rather than lose the message, but
        // not past a stop.
        if (::WaitForSingleObject(gateway_.stop_event(), inject_retry_ms) == WAIT_OBJECT_0) {
          return 0;
        }
        continue;
      default:
        logging::logger_stream(logging::level_warning, log_name())
            << L"pipe=" << pipe_name_ << L" channel=" << channel
            << L": message dropped, parlo_inject err=" << result;
        return 0;
    }
  }
  logging::logger_stream(logging::level_error, log_name())
      << L"pipe=" << pipe_name_ << L" handle=" << handle() << L" channel=" << channel
      << L": the bus's delivery queue stays full";
  return ERROR_NOT_ENOUGH_QUOTA;
}

}  // namespace parlo::ipc::impl
