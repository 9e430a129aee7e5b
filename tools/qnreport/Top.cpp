#include "tools/qnreport/Top.h"

#include <poll.h>
#include <signal.h>
#include <sys/inotify.h>
#include <sys/signalfd.h>
#include <termios.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <deque>
#include <map>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "tools/qnreport/Admin.h"

namespace qn::qnreport {
namespace {

// Every number of a stats file by its dotted path ("store.lag").
using Figures = std::map<std::string, double>;

// The daemon looks at its counters once a second and writes the file only when they
// changed, so each new file holds one second's change, however long the file was idle.
constexpr double kDaemonPeriod = 1.0;

void Flatten(const Dictionary& stats, const std::string& prefix, Figures& out) {
  for (const auto& [key, value] : stats) {
    const std::string name = prefix + key.Description();
    if (const Dictionary* nested = value.as_dictionary()) {
      Flatten(*nested, name + ".", out);
    } else if (const auto number = value.as_double()) {
      out[name] = *number;
    }
  }
}

double At(const Figures& figures, const std::string& name) {
  const auto found = figures.find(name);
  return found == figures.end() ? 0 : found->second;
}

// The figures under `prefix` ("paused."), by the rest of their name up to a colon
// ("requests.sendMessage:withCategory:..." -> "sendMessage").
std::vector<std::pair<std::string, double>> Under(const Figures& figures,
                                                  const std::string& prefix) {
  std::vector<std::pair<std::string, double>> found;
  for (const auto& [name, value] : figures) {
    if (!name.starts_with(prefix)) continue;
    const std::string rest = name.substr(prefix.size());
    found.emplace_back(rest.substr(0, rest.find(':')), value);
  }
  return found;
}

double SteadyNow() {
  return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

// The stats files seen lately, each with the time it was first read.
class History {
 public:
  explicit History(double window) : window_(window) {}

  // Keeps `figures` unless they are the latest already.
  void Add(double time, Figures figures) {
    if (!samples_.empty() && samples_.back().second == figures) return;
    samples_.emplace_back(time, std::move(figures));
    while (samples_.size() > 1 && samples_[1].first < time - window_ - 2 * kDaemonPeriod) {
      samples_.pop_front();
    }
  }
  const Figures& Latest() const { return samples_.back().second; }

  // The change per second of every figure over the window. The window ends at the latest
  // file while the daemon still writes one a second, else now (nothing changed since); it
  // starts at the file that was the latest then (half a period of slack for the daemon's
  // jitter), or the oldest kept. Falling figures (a restarted daemon) count as 0.
  Figures Rates(double now) const {
    const auto& [latest_time, latest] = samples_.back();
    const double end = now - latest_time > 1.5 * kDaemonPeriod ? now : latest_time;
    const Figures* base = &samples_.front().second;
    for (const auto& [time, figures] : samples_) {
      if (time <= end - window_ + kDaemonPeriod / 2) base = &figures;
    }
    Figures rates;
    for (const auto& [name, value] : latest) {
      rates[name] = std::max(0.0, (value - At(*base, name)) / window_);
    }
    return rates;
  }

 private:
  const double window_;
  std::deque<std::pair<double, Figures>> samples_;
};

// What one refresh shows.
struct View {
  std::string problem;          // the daemon is not running (the figures are its last)
  Figures figures;              // the latest file
  Figures rates;                // per second
  std::deque<double> messages;  // messages per second, one per refresh, oldest first
};

std::string Fixed(double value) {
  char text[32];
  std::snprintf(text, sizeof text, "%.1f", value);
  return text;
}

std::string Whole(double value) { return std::to_string(static_cast<long long>(value)); }

std::string Bytes(double bytes) {
  const char* units[] = {"B", "KiB", "MiB", "GiB"};
  int unit = 0;
  while (bytes >= 1024 && unit < 3) {
    bytes /= 1024;
    ++unit;
  }
  return (unit == 0 ? Whole(bytes) : Fixed(bytes)) + " " + units[unit];
}

std::string Clock() {
  const std::time_t now = std::time(nullptr);
  std::tm tm{};
  localtime_r(&now, &tm);
  char text[16];
  std::strftime(text, sizeof text, "%H:%M:%S", &tm);
  return text;
}

// The export's lag, when the stats file has an export section that says it.
std::optional<double> ExportLag(const Figures& figures) {
  for (const char* name : {"export.lag_rows", "export.lag"}) {
    if (figures.contains(name)) return At(figures, name);
  }
  return std::nullopt;
}

bool Utf8Locale() {
  for (const char* name : {"LC_ALL", "LC_CTYPE", "LANG"}) {
    const char* value = std::getenv(name);
    if (value && *value) {
      const std::string text = value;
      return text.find("UTF-8") != std::string::npos || text.find("utf8") != std::string::npos;
    }
  }
  return false;
}

std::string Sparkline(const std::deque<double>& values) {
  static const char* const kBlocks[] = {"▁", "▂", "▃", "▄", "▅", "▆", "▇", "█"};
  static const char* const kAscii[] = {"_", ".", "-", "~", "=", "+", "*", "#"};
  const char* const* levels = Utf8Locale() ? kBlocks : kAscii;
  const double most = values.empty() ? 0 : *std::max_element(values.begin(), values.end());
  std::string line;
  for (const double value : values) {
    line += levels[most > 0 ? static_cast<int>(std::lround(7 * value / most)) : 0];
  }
  return line;
}

std::string Pad(std::string text, std::size_t width) {
  text.resize(std::max(width, text.size() + 1), ' ');
  return text;
}

// "name value  name value ..." for the rates under `prefix`.
std::string RatesUnder(const View& view, const std::string& prefix) {
  std::string line;
  for (const auto& [name, rate] : Under(view.rates, prefix))
    line += name + " " + Fixed(rate) + "  ";
  return line;
}

std::vector<std::string> ScreenLines(const View& view, double interval) {
  const Figures& f = view.figures;
  std::vector<std::string> lines;
  lines.push_back(
      "qnreport top: " +
      (view.problem.empty() ? "qnreportingd pid " + Whole(At(f, "pid")) : view.problem) +
      ", every " + Fixed(interval) + " s, " + Clock() + "; q quits");
  lines.push_back("");
  const double most =
      view.messages.empty() ? 0 : *std::max_element(view.messages.begin(), view.messages.end());
  lines.push_back(Pad("messages/s", 14) + Pad(Fixed(At(view.rates, "messages")), 12) +
                  Sparkline(view.messages) + "  max " + Fixed(most));
  lines.push_back(Pad("rows/s", 14) + Pad(Fixed(At(view.rates, "store.committed")), 12) +
                  "store rows committed");
  lines.push_back("");
  lines.push_back(Pad("connections", 14) + Pad(Whole(At(f, "connections_open")), 12) +
                  Pad("sessions", 20) + Whole(At(f, "sessions_open")));
  lines.push_back(Pad("queued", 14) + Pad(Whole(At(f, "deliveries_queued")), 12) +
                  Pad("aggregated", 20) + Bytes(At(f, "aggregated_bytes")));
  std::string lags = Pad("store lag", 14) + Pad(Whole(At(f, "store.lag")), 12);
  if (const auto lag = ExportLag(f)) lags += Pad("export lag", 20) + Whole(*lag);
  lines.push_back(lags);
  lines.push_back("");
  lines.push_back("requests/s");
  const auto requests = Under(view.rates, "requests.");
  for (std::size_t i = 0; i < requests.size(); i += 2) {
    std::string line;
    for (std::size_t j = i; j < std::min(i + 2, requests.size()); ++j) {
      line += "  " + Pad(requests[j].first, 29) + Pad(Fixed(requests[j].second), 10);
    }
    lines.push_back(line);
  }
  lines.push_back("");
  lines.push_back(Pad("paused/s", 14) + RatesUnder(view, "paused."));
  lines.push_back(Pad("refused/s", 14) + RatesUnder(view, "refused."));
  return lines;
}

double Sum(const Figures& rates, const std::string& prefix) {
  double sum = 0;
  for (const auto& [name, rate] : Under(rates, prefix)) sum += rate;
  return sum;
}

// One line for scripts and logs.
std::string PlainLine(const View& view) {
  if (!view.problem.empty()) return Clock() + " " + view.problem;
  const Figures& f = view.figures;
  std::string line = Clock() + " messages/s " + Fixed(At(view.rates, "messages")) + " rows/s " +
                     Fixed(At(view.rates, "store.committed")) + " requests/s " +
                     Fixed(Sum(view.rates, "requests.")) + " connections " +
                     Whole(At(f, "connections_open")) + " sessions " +
                     Whole(At(f, "sessions_open")) + " queued " +
                     Whole(At(f, "deliveries_queued")) + " aggregated_bytes " +
                     Whole(At(f, "aggregated_bytes")) + " store_lag " + Whole(At(f, "store.lag"));
  if (const auto lag = ExportLag(f)) line += " export_lag " + Whole(*lag);
  return line + " paused/s " + Fixed(Sum(view.rates, "paused.")) + " refused/s " +
         Fixed(Sum(view.rates, "refused."));
}

// Wakes when something in the daemon's runtime folder changes (it renames each new stats
// file into place).
class FolderWatch {
 public:
  explicit FolderWatch(const std::string& dir) : fd_(inotify_init1(IN_CLOEXEC | IN_NONBLOCK)) {
    if (fd_ >= 0) inotify_add_watch(fd_, dir.c_str(), IN_MOVED_TO | IN_CLOSE_WRITE);
  }
  ~FolderWatch() {
    if (fd_ >= 0) ::close(fd_);
  }
  FolderWatch(const FolderWatch&) = delete;
  FolderWatch& operator=(const FolderWatch&) = delete;

  int fd() const { return fd_; }
  void Drain() {
    char buffer[4096];
    while (::read(fd_, buffer, sizeof buffer) > 0) {
    }
  }

 private:
  const int fd_;
};

// The terminal while the view is on it: keys read one by one and not echoed, the
// alternate screen without cursor and line wrap, and SIGINT, SIGTERM, SIGHUP and SIGWINCH
// taken through a descriptor instead of ending the process. The destructor puts all of it
// back as it was.
class TerminalScreen {
 public:
  explicit TerminalScreen(int fd) : fd_(fd) {
    termios settings{};
    if (isatty(STDIN_FILENO) && tcgetattr(STDIN_FILENO, &settings) == 0) {
      saved_ = settings;
      settings.c_lflag &= ~static_cast<tcflag_t>(ICANON | ECHO);
      settings.c_cc[VMIN] = 1;
      settings.c_cc[VTIME] = 0;
      tcsetattr(STDIN_FILENO, TCSANOW, &settings);
      keys_ = STDIN_FILENO;
    }
    sigset_t set;
    sigemptyset(&set);
    for (const int signal : {SIGINT, SIGTERM, SIGHUP, SIGWINCH}) sigaddset(&set, signal);
    pthread_sigmask(SIG_BLOCK, &set, &old_mask_);
    signals_ = signalfd(-1, &set, SFD_CLOEXEC);
    Write("\x1b[?1049h\x1b[?25l\x1b[?7l");
  }
  ~TerminalScreen() {
    Write("\x1b[?7h\x1b[?25h\x1b[?1049l");
    if (saved_) tcsetattr(STDIN_FILENO, TCSANOW, &*saved_);
    if (signals_ >= 0) ::close(signals_);
    pthread_sigmask(SIG_SETMASK, &old_mask_, nullptr);
  }
  TerminalScreen(const TerminalScreen&) = delete;
  TerminalScreen& operator=(const TerminalScreen&) = delete;

  int keys() const { return keys_; }
  int signals() const { return signals_; }

  // Whether the keys typed include q (the end of the terminal's input counts too).
  bool QuitTyped() {
    char typed[64];
    const ssize_t n = ::read(keys_, typed, sizeof typed);
    if (n <= 0) keys_ = -1;
    return n <= 0 ||
           std::find_if(typed, typed + n, [](char c) { return c == 'q' || c == 'Q'; }) != typed + n;
  }
  // The signal taken (0 when none could be read).
  int TakeSignal() {
    signalfd_siginfo info{};
    return ::read(signals_, &info, sizeof info) == sizeof info ? static_cast<int>(info.ssi_signo)
                                                               : 0;
  }

  void Draw(const std::vector<std::string>& lines) {
    std::string screen = "\x1b[H";
    for (const std::string& line : lines) screen += line + "\x1b[K\n";
    Write(screen + "\x1b[J");
  }

 private:
  void Write(const std::string& text) {
    for (std::size_t done = 0; done < text.size();) {
      const ssize_t n = ::write(fd_, text.data() + done, text.size() - done);
      if (n <= 0) return;
      done += static_cast<std::size_t>(n);
    }
  }

  const int fd_;
  int keys_ = -1;
  int signals_ = -1;
  std::optional<termios> saved_;
  sigset_t old_mask_{};
};

}  // namespace

int RunTop(const Paths& paths, const TopOptions& options, std::ostream& out, std::ostream& err) {
  const double window = std::max(options.interval, kDaemonPeriod);
  History history(window);
  View view;
  // Reads the stats file and keeps it when it is new.
  const auto take = [&] {
    auto read = ReadDaemonStats(paths);
    if (const auto* problem = std::get_if<std::string>(&read)) {
      view.problem = *problem;
      return;
    }
    view.problem.clear();
    Figures figures;
    Flatten(std::get<DaemonStats>(read).stats, "", figures);
    history.Add(SteadyNow(), std::move(figures));
  };
  take();
  if (!view.problem.empty()) {
    err << "qnreport: " << view.problem << "\n";
    return 1;
  }

  FolderWatch watch(paths.runtime_dir);
  std::optional<TerminalScreen> screen;
  if (options.terminal >= 0) screen.emplace(options.terminal);
  const std::size_t columns = static_cast<std::size_t>(std::ceil(60 / options.interval));
  const auto refresh = [&] {
    view.figures = history.Latest();
    view.rates = history.Rates(SteadyNow());
    view.messages.push_back(At(view.rates, "messages"));
    if (view.messages.size() > std::min<std::size_t>(columns, 60)) view.messages.pop_front();
  };
  const auto draw = [&] {
    if (screen) {
      screen->Draw(ScreenLines(view, options.interval));
    } else {
      out << PlainLine(view) << "\n" << std::flush;
    }
  };
  view.figures = history.Latest();
  if (screen) draw();

  double next = SteadyNow() + options.interval;
  for (long refreshes = 0;;) {
    pollfd watched[] = {{watch.fd(), POLLIN, 0},
                        {screen ? screen->keys() : -1, POLLIN, 0},
                        {screen ? screen->signals() : -1, POLLIN, 0}};
    const double wait = std::max(0.0, next - SteadyNow());
    ::poll(watched, 3, static_cast<int>(std::ceil(wait * 1000)));
    if (watched[0].revents) {
      watch.Drain();
      take();
    }
    if (watched[1].revents && screen->QuitTyped()) return 0;
    if (watched[2].revents) {
      if (screen->TakeSignal() != SIGWINCH) return 0;
      draw();
    }
    if (SteadyNow() < next) continue;
    take();
    refresh();
    draw();
    if (!out || (options.count && ++refreshes >= *options.count)) return 0;
    next += options.interval;
    if (next < SteadyNow()) next = SteadyNow() + options.interval;
  }
}

}  // namespace qn::qnreport
