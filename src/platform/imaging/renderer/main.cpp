// Draws one SVG: reads it from standard input, and writes the pixels of a square to standard output, four bytes each (red,
// green, blue, opacity). Its one argument is the length of a side.
//
// What is drawn may be hostile. So before the first byte of it is read, everything that drawing needs has been loaded,
// and the process has given up all but reading, writing and its own memory.

#include <librsvg/rsvg.h>
#include <linux/audit.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sched.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <vector>

namespace {

constexpr rlim_t kMemoryMax = 192U << 20;
constexpr rlim_t kSecondsMax = 10;
constexpr unsigned kSideMax = 2048;
constexpr std::size_t kInputMax = 4U << 20;

// Uses what is started or loaded at first use: filters, gradients, clips, text.
constexpr char kWarmUp[] =
    "<svg xmlns='http://www.w3.org/2000/svg' width='8' height='8'>"
    "<defs><filter id='f'><feGaussianBlur stdDeviation='1'/><feDiffuseLighting><feDistantLight/></feDiffuseLighting>"
    "</filter><linearGradient id='g'><stop offset='0' stop-color='red'/></linearGradient>"
    "<clipPath id='c'><circle cx='4' cy='4' r='3'/></clipPath></defs>"
    "<rect width='8' height='8' fill='url(#g)' filter='url(#f)' clip-path='url(#c)'/><text y='6'>a</text></svg>";

#if defined(__x86_64__)
constexpr std::uint32_t kArchitecture = AUDIT_ARCH_X86_64;
#elif defined(__aarch64__)
constexpr std::uint32_t kArchitecture = AUDIT_ARCH_AARCH64;
#else
#error "the numbers of this machine's system calls are not known here"
#endif

void limit(int resource, rlim_t most) {
    const rlimit both{most, most};
    if (::setrlimit(static_cast<__rlimit_resource>(resource), &both) != 0) std::_Exit(2);
}

constexpr sock_filter allow(std::uint32_t call, std::uint8_t rest) {
    return BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, call, rest, 0);
}

/// From here on nothing can be opened, started, sent or asked for. Every thread is bound. A call that is not allowed is
/// refused, so that a library that looks for a file simply finds none.
void giveUpTheWorld() {
    constexpr std::uint32_t kAllowed[] = {__NR_read,
                                          __NR_write,
                                          __NR_close,
                                          __NR_mmap,
                                          __NR_munmap,
                                          __NR_mremap,
                                          __NR_mprotect,
                                          __NR_madvise,
                                          __NR_brk,
                                          __NR_futex,
                                          __NR_exit,
                                          __NR_exit_group,
                                          __NR_getrandom,
                                          __NR_clock_gettime,
                                          __NR_sched_yield,
                                          __NR_rt_sigreturn,
                                          __NR_rt_sigprocmask,
                                          __NR_sched_getaffinity,
                                          __NR_set_robust_list,
                                          __NR_rseq};
    std::vector<sock_filter> program{
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, arch)),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, kArchitecture, 1, 0),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_KILL_PROCESS),
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
        // Threads, by the call whose flags can be looked at; the other is said not to exist.
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, __NR_clone3, 0, 1),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | ENOSYS),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, __NR_clone, 0, 4),
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, args[0])),
        BPF_JUMP(BPF_JMP | BPF_JSET | BPF_K, CLONE_THREAD, 0, 1),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | EPERM),
    };
    for (std::size_t i = 0; i < std::size(kAllowed); ++i)
        program.push_back(allow(kAllowed[i], static_cast<std::uint8_t>(std::size(kAllowed) - i)));
    program.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | EPERM));
    program.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW));
    const sock_fprog filter{static_cast<unsigned short>(program.size()), program.data()};
    if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0 ||
        ::syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, SECCOMP_FILTER_FLAG_TSYNC, &filter) != 0) {
        std::_Exit(2);
    }
}

std::vector<guint8> readAll() {
    std::vector<guint8> data;
    while (true) {
        guint8 buffer[65'536];
        const ssize_t got = ::read(STDIN_FILENO, buffer, sizeof buffer);
        if (got < 0 && errno == EINTR) continue;
        if (got < 0 || data.size() + static_cast<std::size_t>(got) > kInputMax) std::_Exit(1);
        if (got == 0) return data;
        data.insert(data.end(), buffer, buffer + got);
    }
}

void writeAll(const std::vector<unsigned char>& data) {
    for (std::size_t done = 0; done < data.size();) {
        const ssize_t written = ::write(STDOUT_FILENO, data.data() + done, data.size() - done);
        if (written < 0 && errno == EINTR) continue;
        if (written <= 0) std::_Exit(1);
        done += static_cast<std::size_t>(written);
    }
}

/// The pixels, or nothing where it is no drawing.
std::vector<unsigned char> draw(const guint8* data, std::size_t size, unsigned side) {
    // Without a base there is nothing that a reference could be relative to; none is followed.
    RsvgHandle* handle = rsvg_handle_new_from_data(data, size, nullptr);
    if (handle == nullptr) return {};
    const int length = static_cast<int>(side);
    cairo_surface_t* surface = cairo_image_surface_create(CAIRO_FORMAT_ARGB32, length, length);
    cairo_t* context = cairo_create(surface);
    const RsvgRectangle viewport{0, 0, static_cast<double>(side), static_cast<double>(side)};
    const bool isDrawn = rsvg_handle_render_document(handle, context, &viewport, nullptr) != FALSE &&
                         cairo_status(context) == CAIRO_STATUS_SUCCESS;
    cairo_surface_flush(surface);
    std::vector<unsigned char> pixels;
    const unsigned char* rows = cairo_image_surface_get_data(surface);
    const int stride = cairo_image_surface_get_stride(surface);
    if (isDrawn && rows != nullptr) {
        pixels.reserve(std::size_t{side} * side * 4);
        for (int y = 0; y < length; ++y) {
            for (int x = 0; x < length; ++x) {
                // One number in the machine's order, colours multiplied with the opacity.
                const auto pixel = reinterpret_cast<const std::uint32_t*>(rows + std::ptrdiff_t{y} * stride)[x];
                const std::uint32_t opacity = pixel >> 24;
                for (const unsigned shift : {16U, 8U, 0U}) {
                    const std::uint32_t colour = (pixel >> shift) & 0xFF;
                    const std::uint32_t plain = opacity == 0 ? 0 : (colour * 255 + opacity / 2) / opacity;
                    pixels.push_back(static_cast<unsigned char>(plain > 255 ? 255 : plain));
                }
                pixels.push_back(static_cast<unsigned char>(opacity));
            }
        }
    }
    cairo_destroy(context);
    cairo_surface_destroy(surface);
    g_object_unref(handle);
    return pixels;
}

}  // namespace

int main(int argc, char** argv) {
    const unsigned long side = argc == 2 ? std::strtoul(argv[1], nullptr, 10) : 0;
    if (side == 0 || side > kSideMax) return 2;
    // One thread is enough, and is started by the first drawing. No fonts: they would have to be opened when they are
    // wanted; and nothing is to be written into anybody's cache.
    ::setenv("RAYON_NUM_THREADS", "1", 1);
    ::setenv("FONTCONFIG_FILE", "", 1);
    ::setenv("XDG_CACHE_HOME", "/dev/null", 1);
    limit(RLIMIT_CORE, 0);
    limit(RLIMIT_DATA, kMemoryMax);
    limit(RLIMIT_CPU, kSecondsMax);
    if (::close_range(STDERR_FILENO + 1, ~0U, 0) != 0) return 2;
    if (draw(reinterpret_cast<const guint8*>(kWarmUp), sizeof kWarmUp - 1, 8).empty()) return 2;
    giveUpTheWorld();

    const std::vector<guint8> data = readAll();
    const std::vector<unsigned char> pixels = draw(data.data(), data.size(), static_cast<unsigned>(side));
    if (pixels.empty()) std::_Exit(1);
    writeAll(pixels);
    // Without the work at an exit, which nothing here needs.
    std::_Exit(0);
}
