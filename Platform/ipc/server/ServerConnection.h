// One connection of the server.
//
// At any time it is either armed in the worker pool, for bytes to read or, while replies wait, for
// room to write, or it is on its turn: one worker reads, handles frames and arms it again. Only the
// turn touches what has been read. Replies come from any thread, also while no turn is on: they go
// straight to the socket, and what it does not take waits in the output buffer.
//
// It ends once. The descriptor is closed by the turn that is on, or at once when none is, so that
// nobody reads from a number that means something else by then.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <vector>

#include "Platform/base/FileDescriptor.h"
#include "Platform/base/Mutex.h"
#include "Platform/ipc/Codec.h"
#include "Platform/ipc/server/Peer.h"
#include "Platform/ipc/server/UserAccounts.h"

namespace platform::ipc {

class ServerCore;

class ServerConnection : public std::enable_shared_from_this<ServerConnection> {
 public:
  using Clock = std::chrono::steady_clock;

  // `token` names it in the pool and in the core's table.
  ServerConnection(std::shared_ptr<ServerCore> core, uint64_t token, FileDescriptor socket,
                   Peer peer, std::shared_ptr<UserAccount> account);
  ~ServerConnection();

  const Peer& peer() const { return peer_; }
  uint64_t token() const { return token_; }
  // For adding it to the pool, before its first turn.
  int descriptor() const { return socket_.get(); }

  // A turn: called by the worker that was given an event.
  void serve(std::span<uint8_t> scratch) EXCLUDES(mutex_);
  // Sends a frame, or keeps it until the peer takes it. Any thread.
  void send(std::vector<uint8_t> frame) EXCLUDES(mutex_);
  // Ends the connection; a reason that is not empty becomes a line in the log. Any thread.
  void end(const std::string& reason) EXCLUDES(mutex_);
  // Ends it when it has waited since before `deadline` for the peer to move a byte. Any thread.
  void endIfStalledSince(Clock::time_point deadline) EXCLUDES(mutex_);

 private:
  bool beginTurn() EXCLUDES(mutex_);
  void endTurn() EXCLUDES(mutex_);
  bool mayTakeFrame() EXCLUDES(mutex_);
  bool readOnce(std::span<uint8_t> scratch);
  void keepInput(std::span<const uint8_t> bytes);
  void takeFrames();
  size_t handleFrames(std::span<const uint8_t> bytes);
  void handleFrame(const FrameHeader& header, std::span<const uint8_t> body);

  bool hasOutput() const REQUIRES(mutex_) { return !output_.empty(); }
  bool sendNow(std::span<const uint8_t>& bytes) REQUIRES(mutex_);
  void flush() REQUIRES(mutex_);
  void keep(std::vector<uint8_t> frame, size_t alreadySent) REQUIRES(mutex_);
  void dropOutput() REQUIRES(mutex_);
  void watch() REQUIRES(mutex_);
  void endLocked(const std::string& reason) REQUIRES(mutex_);
  void finish() REQUIRES(mutex_);

  const std::shared_ptr<ServerCore> core_;
  const uint64_t token_;
  const Peer peer_;
  const std::shared_ptr<UserAccount> account_;

  // Of the turn that is on.
  FileDescriptor socket_;       // valid until finish()
  std::vector<uint8_t> input_;  // read, but not handled
  BufferCharge inputCharge_;
  bool progress_ = false;  // a byte was moved in this turn

  Mutex mutex_;
  bool onTurn_ GUARDED_BY(mutex_) = false;
  bool ended_ GUARDED_BY(mutex_) = false;
  std::vector<uint8_t> output_ GUARDED_BY(mutex_);  // empty as soon as all of it is sent
  size_t sent_ GUARDED_BY(mutex_) = 0;              // of output_
  BufferCharge outputCharge_ GUARDED_BY(mutex_);
  bool watched_ GUARDED_BY(mutex_) = false;  // by the core, for lack of progress
  Clock::time_point lastProgress_ GUARDED_BY(mutex_);
};

}  // namespace platform::ipc
