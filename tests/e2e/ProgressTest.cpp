// transvale's progress display as people see it: on a terminal (a
// pseudo-terminal here) a bar redrawn in place that fits the window and
// follows a change of its size; elsewhere one line per finished entry.
#include <fcntl.h>
#include <poll.h>
#include <stdlib.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <optional>
#include <regex>

#include <gtest/gtest.h>

#include "Platform/Foundation/Text.h"
#include "Platform/PosixHandles.h"
#include "e2e/Programs.h"
#include "support/TestSupport.h"

namespace qstest {
namespace {

using platform::ScopedFD;

constexpr unsigned short kWideColumns = 120, kNarrowColumns = 32, kRows = 24;
constexpr char kApplications[] = "8";
constexpr char kEntries[] = "9/9 entries";  // the applications and the image's one container without a bundle
// The log's pipe holds one page: a run can get no further than a page of log
// beyond what the test has read, while its progress thread keeps drawing.
constexpr int kLogPipeBytes = 4096;
// Only a guard against a run that hangs; nothing waits for time to pass.
constexpr int kHungRunMilliseconds = 120000;
constexpr char kClearToEndOfLine[] = "\033[K";
// Redraws of the old width that may follow a change of size: one being
// drawn, one written but still on its way through the terminal.
constexpr int kDrawsUnderWay = 2;

// One redraw of the bar: the text between "\r" and the clear to the end of
// the line.
struct Draw {
  std::string text;
  size_t columns = 0;
  size_t barWidth = 0;  // between "[" and "]"
};

// The bar takes a third of the width, within 10 and 40 columns.
size_t barWidthFor(unsigned short columns) {
  return std::clamp<size_t>(columns / 3, 10, 40);
}

// transvale with a pseudo-terminal as its controlling terminal and standard
// error, its log going into a FIFO that the test reads only when told to.
class TerminalRun {
 public:
  TerminalRun(const std::string& image, const std::string& dir, unsigned short columns) {
    master_ = ScopedFD(posix_openpt(O_RDWR | O_NOCTTY | O_CLOEXEC));
    EXPECT_GE(master_.get(), 0) << std::strerror(errno);
    EXPECT_EQ(grantpt(master_.get()), 0) << std::strerror(errno);
    EXPECT_EQ(unlockpt(master_.get()), 0) << std::strerror(errno);
    const std::string terminal = ptsname(master_.get());
    // Held open so that the end of the output is the display's last newline,
    // never an error of a terminal nobody holds.
    terminal_ = ScopedFD(::open(terminal.c_str(), O_RDWR | O_NOCTTY | O_CLOEXEC));
    resize(columns, false);
    const std::string fifo = dir + "/log.fifo";
    EXPECT_EQ(mkfifo(fifo.c_str(), 0600), 0);
    log_ = ScopedFD(::open(fifo.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
    EXPECT_EQ(fcntl(log_.get(), F_SETPIPE_SZ, kLogPipeBytes), kLogPipeBytes);
    pid_ = fork();
    if (pid_ != 0) return;
    // The child: a session of its own whose controlling terminal is the
    // pseudo-terminal, so that the kernel tells it of size changes.
    const int in = ::open("/dev/null", O_RDONLY), out = ::open((dir + "/stdout").c_str(), O_WRONLY | O_CREAT, 0600);
    if (setsid() < 0 || in < 0 || out < 0 || dup2(in, STDIN_FILENO) < 0 || dup2(out, STDOUT_FILENO) < 0) _exit(126);
    const int err = ::open(terminal.c_str(), O_RDWR);
    if (err < 0 || dup2(err, STDERR_FILENO) < 0) _exit(126);
    setenv("TMPDIR", (dir + "/tmp").c_str(), 1);
    unsetenv("QS_SYSTEM_ROOT");
    const std::string program = kBin + "/transvale";
    execl(program.c_str(), program.c_str(), "--root", image.c_str(), "--log", fifo.c_str(), nullptr);
    _exit(127);
  }
  ~TerminalRun() {
    if (pid_ > 0 && !waited_) {
      ::kill(pid_, SIGKILL);
      (void)wait();
    }
  }

  // A new window size, told to the child as a terminal emulator does.
  void resize(unsigned short columns, bool signal = true) {
    struct winsize size {};
    size.ws_row = kRows;
    size.ws_col = columns;
    EXPECT_EQ(ioctl(master_.get(), TIOCSWINSZ, &size), 0);
    if (signal) {
      EXPECT_EQ(::kill(pid_, SIGWINCH), 0);
    }
  }

  // The next redraw; none once the display has ended its line, or when none
  // came within `waitMs`. With `readLog` the run's log is read meanwhile, so
  // the run goes on.
  std::optional<Draw> nextDraw(bool readLog, int waitMs = kHungRunMilliseconds) {
    for (;;) {
      const size_t clear = output_.find(kClearToEndOfLine);
      if (clear != std::string::npos) {
        const size_t start = output_.rfind('\r', clear);
        Draw draw;
        if (start != std::string::npos) draw.text = output_.substr(start + 1, clear - start - 1);
        output_.erase(0, clear + std::strlen(kClearToEndOfLine));
        draw.columns = platform::displayColumns(draw.text);
        if (draw.text.starts_with("[")) draw.barWidth = draw.text.find(']') - 1;
        return draw;
      }
      if (output_.find('\n') != std::string::npos) return std::nullopt;
      pollfd fds[] = {{master_.get(), POLLIN, 0}, {readLog ? log_.get() : -1, POLLIN, 0}};
      const int ready = poll(fds, std::size(fds), waitMs);
      if (ready == 0 && waitMs == 0) return std::nullopt;
      if (ready <= 0) {
        ADD_FAILURE() << "no output for " << kHungRunMilliseconds << " ms; so far: " << output_;
        return std::nullopt;
      }
      char buffer[4096];
      if (fds[0].revents & POLLIN) {
        const ssize_t n = ::read(master_.get(), buffer, sizeof buffer);
        if (n > 0) output_.append(buffer, static_cast<size_t>(n));
      }
      if (fds[1].revents & (POLLIN | POLLHUP)) {
        // The log itself is not looked at; at its end (the run closed it) it
        // is no longer polled.
        if (::read(log_.get(), buffer, sizeof buffer) == 0) log_.reset(-1);
      }
    }
  }

  int wait() {
    waited_ = true;
    int status = 0;
    while (waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

 private:
  ScopedFD master_, terminal_, log_;
  pid_t pid_ = -1;
  bool waited_ = false;
  std::string output_;
};

class Progress : public testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(makeDirs(dir_ / "tmp")); }
  // A fresh image of kApplications applications.
  std::string image(const std::string& name) {
    const std::string root = dir_ / name;
    EXPECT_EQ(
        Process({"devicegen", "create", "--root", root, "--apps", kApplications, "--seed", "3"}, dir_.path()).wait(),
        0);
    return root;
  }
  TempDir dir_{"progress"};
};

TEST_F(Progress, BarFitsTheTerminalAndFollowsAChangeOfItsWidth) {
  const std::string root = image("image");
  TerminalRun run(root, dir_.path(), kWideColumns);
  // While the log is not read the run cannot end, whatever its speed.
  const std::optional<Draw> wide = run.nextDraw(false);
  ASSERT_TRUE(wide);
  EXPECT_EQ(wide->barWidth, barWidthFor(kWideColumns)) << wide->text;
  EXPECT_LT(wide->columns, kWideColumns) << wide->text;

  // What was drawn so far fits the old width.
  for (std::optional<Draw> old; (old = run.nextDraw(false, 0));) EXPECT_LT(old->columns, kWideColumns) << old->text;

  run.resize(kNarrowColumns);
  // A redraw under way when the size changed, or written but not yet passed
  // through the terminal, may still have the old width; then come redraws of
  // the new width only.
  std::optional<Draw> draw;
  for (int old = 0; (draw = run.nextDraw(false)) && draw->barWidth != barWidthFor(kNarrowColumns); ++old) {
    ASSERT_LT(old, kDrawsUnderWay) << "no redraw to the new width: " << draw->text;
    EXPECT_LT(draw->columns, kWideColumns) << draw->text;
  }
  ASSERT_TRUE(draw);
  Draw last;
  for (; draw; draw = run.nextDraw(true)) {
    EXPECT_EQ(draw->barWidth, barWidthFor(kNarrowColumns)) << draw->text;
    EXPECT_LT(draw->columns, kNarrowColumns) << draw->text;
    last = *draw;
  }
  EXPECT_TRUE(last.text.starts_with("[" + std::string(barWidthFor(kNarrowColumns), '#') + "] 100%")) << last.text;
  EXPECT_EQ(run.wait(), 0);
}

TEST_F(Progress, WithoutATerminalEachFinishedEntryGetsOneLine) {
  const std::string root = image("image");
  ASSERT_EQ(Process({"transvale", "--root", root}, dir_.path()).wait(), 0);
  const std::string err = readFile(dir_ / "stderr");
  EXPECT_EQ(err.find_first_of("\r\033"), std::string::npos) << "terminal controls in: " << err;
  // "progress: P% (K/9 entries...)": K grows by at least one from line to line,
  // and the last line is the end.
  const std::regex step(R"(progress: (\d+)% \((\d+)/9 entries[^)]*\)\n)");
  long previous = -1;
  std::string lastLine;
  size_t lines = 0;
  for (std::sregex_iterator it(err.begin(), err.end(), step), end; it != end; ++it, ++lines) {
    const long done = std::stol((*it)[2]);
    EXPECT_GT(done, previous) << (*it)[0];
    previous = done;
    lastLine = (*it)[0];
  }
  EXPECT_EQ(static_cast<size_t>(std::count(err.begin(), err.end(), '\n')), lines) << err;
  EXPECT_TRUE(lastLine.starts_with(std::string("progress: 100% (") + kEntries)) << err;
}

}  // namespace
}  // namespace qstest
