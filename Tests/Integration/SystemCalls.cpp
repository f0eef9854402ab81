#include "Tests/Integration/SystemCalls.h"

#include <elf.h>
#include <fcntl.h>
#include <linux/openat2.h>
#include <signal.h>
#include <sys/ptrace.h>
#include <sys/syscall.h>
#include <sys/uio.h>
#include <sys/user.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <exception>
#include <filesystem>
#include <map>
#include <optional>
#include <set>
#include <stdexcept>
#include <thread>

namespace {

using SystemCallInfo = struct __ptrace_syscall_info;

constexpr int kNoPath = -1;

struct KnownCall {
  long number;
  const char* name;
  int pathArgument;
  bool changes;
};

constexpr KnownCall kFileCalls[] = {
    {SYS_openat, "openat", 1, false},  // changes with O_CREAT
    {SYS_openat2, "openat2", 1, false},
    {SYS_newfstatat, "newfstatat", 1, false},
    {SYS_fstat, "fstat", kNoPath, false},
    {SYS_statx, "statx", 1, false},
    {SYS_read, "read", kNoPath, false},
    {SYS_pread64, "pread64", kNoPath, false},
    {SYS_getdents64, "getdents64", kNoPath, false},
    {SYS_getxattr, "getxattr", 0, false},
    {SYS_lgetxattr, "lgetxattr", 0, false},
    {SYS_fgetxattr, "fgetxattr", kNoPath, false},
    {SYS_setxattr, "setxattr", 0, true},
    {SYS_lsetxattr, "lsetxattr", 0, true},
    {SYS_fsetxattr, "fsetxattr", kNoPath, true},
    {SYS_mkdirat, "mkdirat", 1, true},
    {SYS_unlinkat, "unlinkat", 1, true},
    {SYS_renameat, "renameat", 1, true},
    {SYS_renameat2, "renameat2", 1, true},
    {SYS_linkat, "linkat", 1, true},
    {SYS_symlinkat, "symlinkat", 2, true},
    {SYS_fchownat, "fchownat", 1, true},
    {SYS_fchown, "fchown", kNoPath, true},
    {SYS_fchmodat, "fchmodat", 1, true},
    {SYS_fchmod, "fchmod", kNoPath, true},
    {SYS_write, "write", kNoPath, true},
    {SYS_pwrite64, "pwrite64", kNoPath, true},
    {SYS_ftruncate, "ftruncate", kNoPath, true},
    {SYS_copy_file_range, "copy_file_range", kNoPath, true},
    {SYS_fsync, "fsync", kNoPath, true},
    {SYS_fdatasync, "fdatasync", kNoPath, true},
};

void readMemory(pid_t process, uint64_t address, void* to, size_t size) {
  const iovec local{to, size};
  const iovec remote{reinterpret_cast<void*>(address), size};
  // A read that ends at an unmapped page is short: what is there counts.
  (void)::process_vm_readv(process, &local, 1, &remote, 1, 0);
}

// A sanitizer probes memory by writing it to a pipe.
bool isOfAFile(pid_t process, uint64_t descriptor) {
  std::error_code gone;
  const std::string link = "/proc/" + std::to_string(process) + "/fd/" + std::to_string(descriptor);
  return std::filesystem::read_symlink(link, gone).string().starts_with('/');
}

std::optional<FileCall> fileCall(pid_t process, const SystemCallInfo& info) {
  const auto* const known = std::ranges::find_if(kFileCalls, [&](const KnownCall& call) {
    return static_cast<uint64_t>(call.number) == info.entry.nr;
  });
  if (known == std::end(kFileCalls)) return std::nullopt;
  FileCall call{.name = known->name, .path = {}, .changes = known->changes};
  if (known->pathArgument == kNoPath && !isOfAFile(process, info.entry.args[0])) {
    return std::nullopt;
  }
  if (known->pathArgument != kNoPath) {
    std::array<char, 512> text{};
    readMemory(process, info.entry.args[known->pathArgument], text.data(), text.size() - 1);
    call.path = text.data();
  }
  if (known->number == SYS_openat || known->number == SYS_openat2) {
    open_how how{.flags = info.entry.args[2], .mode = 0, .resolve = 0};
    if (known->number == SYS_openat2) readMemory(process, info.entry.args[2], &how, sizeof how);
    call.changes = (how.flags & O_CREAT) != 0;
    call.locatesOnly = (how.flags & O_PATH) != 0;
  }
  return call;
}

template <typename Registers>
void changeRegisters(pid_t thread, int kind, const std::function<void(Registers&)>& change) {
  Registers registers{};
  iovec area{&registers, sizeof registers};
  ::ptrace(PTRACE_GETREGSET, thread, kind, &area);
  change(registers);
  ::ptrace(PTRACE_SETREGSET, thread, kind, &area);
}

// At its entry: no system call has this number.
void skipCall(pid_t thread) {
#if defined(__x86_64__)
  changeRegisters<user_regs_struct>(thread, NT_PRSTATUS, [](auto& all) { all.orig_rax = ~0ULL; });
#elif defined(__aarch64__)
  changeRegisters<int>(thread, NT_ARM_SYSTEM_CALL, [](int& number) { number = -1; });
#else
#error "the registers of this machine are not known"
#endif
}

// At its exit.
void setResult(pid_t thread, int error) {
  changeRegisters<user_regs_struct>(thread, NT_PRSTATUS, [error](auto& all) {
#if defined(__x86_64__)
    auto& result = all.rax;
#else
    auto& result = all.regs[0];
#endif
    result = static_cast<unsigned long long>(-static_cast<long long>(error));
  });
}

std::set<pid_t> threadsOf(pid_t process) {
  std::set<pid_t> threads;
  std::error_code gone;
  const std::string tasks = "/proc/" + std::to_string(process) + "/task";
  for (const auto& task : std::filesystem::directory_iterator(tasks, gone)) {
    threads.insert(std::stoi(task.path().filename().string()));
  }
  return threads;
}

class Tracer {
 public:
  Tracer(pid_t process, const CallJudge& judge) : process_(process), judge_(judge) {}

  // Stops all threads before the first one goes on: one that runs untraced could make another, or
  // take the request.
  void attach() {
    // Threads that appear from now on are traced with the one that makes them.
    constexpr long kOptions = PTRACE_O_TRACESYSGOOD | PTRACE_O_TRACECLONE;
    std::set<pid_t> stopped;
    for (bool isComplete = false; !isComplete;) {
      isComplete = true;
      for (const pid_t thread : threadsOf(process_)) {
        if (::ptrace(PTRACE_SEIZE, thread, 0, kOptions) != 0) continue;  // traced already, or gone
        ::ptrace(PTRACE_INTERRUPT, thread, 0, 0);
        add(thread);
        isComplete = false;
      }
      if (threads_.empty()) throw std::runtime_error("the daemon cannot be traced");
      while (!std::ranges::includes(stopped, threads_)) stopped.insert(await().thread);
    }
    for (const pid_t thread : stopped) ::ptrace(PTRACE_SYSCALL, thread, 0, 0);
  }

  void run() {
    while (!isDone_ && !threads_.empty()) awaitAndResume();
    if (!threads_.empty()) detach();
  }

  // The kernel lets the last thread, the process's own, end when all others have been waited for.
  void kill() {
    threads_.merge(threadsOf(process_));
    ::kill(process_, SIGKILL);
    for (const pid_t thread : threads_) {
      int status = 0;
      while (thread != process_ && ::waitpid(thread, &status, __WALL) == thread &&
             WIFSTOPPED(status)) {
      }
    }
    threads_.clear();
    isDone_ = true;
  }

  std::vector<FileCall> takeCalls() { return std::move(calls_); }

 private:
  struct Stop {
    pid_t thread;
    int status;
    bool isEnd() const { return !WIFSTOPPED(status); }
    bool isSystemCall() const { return WSTOPSIG(status) == (SIGTRAP | 0x80); }
    bool isEvent() const { return status >> 16 != 0; }
    bool isClone() const { return status >> 8 == (SIGTRAP | PTRACE_EVENT_CLONE << 8); }
    // What goes on to the thread when it is resumed.
    int signal() const { return isSystemCall() || isEvent() ? 0 : WSTOPSIG(status); }
  };

  Stop await() {
    Stop stop{-1, 0};
    do {
      stop.thread = ::waitpid(-1, &stop.status, __WALL);
    } while (stop.thread < 0 && errno == EINTR);
    if (stop.thread < 0) threads_.clear();
    if (stop.thread < 0 || stop.isEnd()) {
      threads_.erase(stop.thread);
      return stop;
    }
    add(stop.thread);
    if (stop.isClone()) {
      // Traced already, and not to be left behind before it has stopped for the first time.
      unsigned long made = 0;
      ::ptrace(PTRACE_GETEVENTMSG, stop.thread, 0, &made);
      add(static_cast<pid_t>(made));
    }
    return stop;
  }

  // A new thread may stop, and be gone again, before the one that made it tells of it.
  void add(pid_t thread) {
    if (seen_.insert(thread).second) threads_.insert(thread);
  }

  void awaitAndResume() {
    const Stop stop = await();
    if (stop.thread < 0 || stop.isEnd()) return;
    if (stop.isSystemCall()) systemCall(stop.thread);
    if (!isDone_) ::ptrace(PTRACE_SYSCALL, stop.thread, 0, stop.signal());
    if (isDone_ && !threads_.empty()) ::ptrace(PTRACE_DETACH, stop.thread, 0, 0);
    if (isDone_) threads_.erase(stop.thread);
  }

  void systemCall(pid_t thread) {
    SystemCallInfo info{};
    ::ptrace(PTRACE_GET_SYSCALL_INFO, thread, sizeof info, &info);
    if (info.op == PTRACE_SYSCALL_INFO_ENTRY) {
      inCall_[thread] = info.entry.nr;
      if (thread == serving_) enter(info);
    } else if (info.op == PTRACE_SYSCALL_INFO_EXIT) {
      const bool isReceiving = inCall_[thread] == SYS_recvfrom || inCall_[thread] == SYS_recvmsg;
      if (isReceiving && info.exit.rval > 0 && serving_ < 0) serving_ = thread;
      if (thread == serving_) leave();
    }
  }

  void enter(const SystemCallInfo& info) {
    isDone_ = info.entry.nr == SYS_sendto || info.entry.nr == SYS_sendmsg;
    verdict_ = {};
    auto call = fileCall(process_, info);
    if (!call) return;
    verdict_ = judge_(*call, calls_.size());
    calls_.push_back(std::move(*call));
    if (verdict_.kind == Verdict::Kind::fail) skipCall(serving_);
    if (verdict_.kind == Verdict::Kind::killBefore) kill();
  }

  void leave() {
    if (verdict_.kind == Verdict::Kind::fail) setResult(serving_, verdict_.error);
    if (verdict_.kind == Verdict::Kind::killAfter) kill();
    verdict_ = {};
  }

  void detach() {
    for (const pid_t thread : threads_) ::ptrace(PTRACE_INTERRUPT, thread, 0, 0);
    while (!threads_.empty()) {
      const Stop stop = await();
      if (stop.thread < 0 || stop.isEnd()) continue;
      ::ptrace(PTRACE_DETACH, stop.thread, 0, stop.signal());
      threads_.erase(stop.thread);
    }
  }

  const pid_t process_;
  const CallJudge& judge_;
  std::set<pid_t> threads_;  // those that are traced
  std::set<pid_t> seen_;
  std::map<pid_t, uint64_t> inCall_;  // the number of the call that a thread is in
  pid_t serving_ = -1;
  Verdict verdict_;  // of the call that the serving thread is in
  std::vector<FileCall> calls_;
  bool isDone_ = false;
};

}  // namespace

std::string whyNotTraceable() {
  if (::geteuid() != 0) return "needs root";
  const pid_t child = ::fork();
  if (child == 0) {
    ::pause();
    ::_exit(0);
  }
  const bool isTraceable = ::ptrace(PTRACE_SEIZE, child, 0, 0) == 0;
  ::kill(child, SIGKILL);
  ::waitpid(child, nullptr, 0);
  return isTraceable ? "" : "ptrace is not permitted here";
}

std::vector<FileCall> traceRequest(pid_t process, const std::function<void()>& request,
                                   const CallJudge& judge) {
  Tracer tracer(process, judge);
  tracer.attach();
  std::thread client(request);
  std::exception_ptr failure;
  try {
    tracer.run();
  } catch (...) {
    // The judge's. Only a dead daemon is sure to let the client go.
    failure = std::current_exception();
    tracer.kill();
  }
  client.join();
  if (failure) std::rethrow_exception(failure);
  return tracer.takeCalls();
}
