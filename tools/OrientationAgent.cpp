// vxreporting-orientation-agent [FILE]: says in a file how the user interface is oriented, as the
// Wayland compositor has turned its first output. Runs in the graphical session, as its user.
#include <fcntl.h>
#include <unistd.h>
#include <wayland-client.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace {

constexpr const char* kDefaultFile = "/run/vxreporting/interface/orientation";
constexpr std::size_t kMaxOutputs = 16;

// A quarter turn from each to the next, as wl_output.transform counts them.
constexpr std::array<std::string_view, 4> kWords{"portrait", "landscape-left",
                                                 "portrait-upside-down", "landscape-right"};

struct Output {
  wl_output* proxy = nullptr;
  uint32_t name = 0;  // the compositor's
  uint32_t quarters = 0;
  bool wide = false;  // as the panel is built
  ~Output() {
    if (proxy != nullptr) wl_output_destroy(proxy);
  }
};

// The compositor's outputs, in the order in which it told of them; more than kMaxOutputs are not
// looked at.
class Outputs {
 public:
  explicit Outputs(wl_display* display) : registry_(wl_display_get_registry(display)) {
    static const wl_registry_listener kListener{.global = added, .global_remove = removed};
    wl_registry_add_listener(registry_, &kListener, this);
  }
  ~Outputs() { wl_registry_destroy(registry_); }
  Outputs(const Outputs&) = delete;
  Outputs& operator=(const Outputs&) = delete;

  // Empty while there is no output.
  std::string_view word() const {
    if (outputs_.empty()) return {};
    const Output& first = *outputs_.front();
    // A panel that is wide as it is built lies a quarter turn from one that is tall.
    return kWords[(first.quarters + (first.wide ? 1 : 0)) % kWords.size()];
  }

 private:
  static void added(void* self, wl_registry* registry, uint32_t name, const char* interface,
                    uint32_t) {
    auto& outputs = static_cast<Outputs*>(self)->outputs_;
    if (std::strcmp(interface, wl_output_interface.name) != 0 || outputs.size() >= kMaxOutputs)
      return;
    static const wl_output_listener kListener{.geometry = geometry,
                                              .mode = mode,
                                              .done = nullptr,   // of version 2
                                              .scale = nullptr,  // of version 2
                                              .name = nullptr,
                                              .description = nullptr};
    auto output = std::make_unique<Output>();
    output->name = name;
    output->proxy =
        static_cast<wl_output*>(wl_registry_bind(registry, name, &wl_output_interface, 1));
    wl_output_add_listener(output->proxy, &kListener, output.get());
    outputs.push_back(std::move(output));
  }
  static void removed(void* self, wl_registry*, uint32_t name) {
    std::erase_if(static_cast<Outputs*>(self)->outputs_,
                  [name](const auto& output) { return output->name == name; });
  }
  static void geometry(void* output, wl_output*, int32_t, int32_t, int32_t, int32_t, int32_t,
                       const char*, const char*, int32_t transform) {
    // The four above are the same turns of a mirrored picture.
    static_cast<Output*>(output)->quarters = static_cast<uint32_t>(transform) % 4;
  }
  static void mode(void* output, wl_output*, uint32_t flags, int32_t width, int32_t height,
                   int32_t) {
    if ((flags & WL_OUTPUT_MODE_CURRENT) != 0) static_cast<Output*>(output)->wide = width > height;
  }

  wl_registry* const registry_;
  std::vector<std::unique_ptr<Output>> outputs_;
};

// Whole or not at all: beside the file, then in its place.
bool writeWord(const std::string& path, std::string_view word) {
  const std::string fresh = path + ".new";
  const std::string line = std::string(word) + "\n";
  (void)unlink(fresh.c_str());
  const int fd = open(fresh.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644);
  const bool written =
      fd >= 0 && write(fd, line.data(), line.size()) == static_cast<ssize_t>(line.size());
  const int error = errno;
  if (fd >= 0) close(fd);
  errno = error;
  if (written && std::rename(fresh.c_str(), path.c_str()) == 0) return true;
  const char* why = std::strerror(errno);
  std::fprintf(stderr,
               "vxreporting-orientation-agent: cannot write %s: %s; is this user a member of "
               "vxreporting-agents?\n",
               path.c_str(), why);
  return false;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc > 2 || (argc == 2 && argv[1][0] == '-')) {
    std::fprintf(stderr, "usage: vxreporting-orientation-agent [FILE]\n");
    return 2;
  }
  const std::string path = argc > 1 ? argv[1] : kDefaultFile;
  const std::unique_ptr<wl_display, decltype(&wl_display_disconnect)> display(
      wl_display_connect(nullptr), wl_display_disconnect);
  if (display == nullptr) {
    std::fprintf(stderr,
                 "vxreporting-orientation-agent: there is no Wayland compositor at "
                 "$WAYLAND_DISPLAY: %s\n",
                 std::strerror(errno));
    return 1;
  }
  const Outputs outputs(display.get());
  // The outputs, then what each of them is.
  int told = std::min(wl_display_roundtrip(display.get()), wl_display_roundtrip(display.get()));
  for (std::string_view written; told >= 0; told = wl_display_dispatch(display.get())) {
    const std::string_view word = outputs.word();
    if (word.empty() || word == written) continue;
    if (!writeWord(path, word)) return 1;
    written = word;
  }
  std::fprintf(stderr, "vxreporting-orientation-agent: the compositor has gone: %s\n",
               std::strerror(wl_display_get_error(display.get())));
  return 1;
}
