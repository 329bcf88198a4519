// Preloaded into qmd by `make bench` to count heap allocations: every
// malloc, calloc, realloc and aligned allocation (operator new lands in
// malloc) adds one. SIGUSR2 writes the count so far, in decimal, to the file
// named by QM_ALLOCATION_COUNT_FILE. Async-signal-safe: the handler only
// formats a number and calls open/write/close.

#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstddef>
#include <cstdlib>

extern "C" {
void* __libc_malloc(std::size_t size);
void* __libc_calloc(std::size_t count, std::size_t size);
void* __libc_realloc(void* pointer, std::size_t size);
void* __libc_memalign(std::size_t alignment, std::size_t size);
}

namespace {

std::atomic<unsigned long long> allocations{0};
const char* countFile = nullptr;

void writeCount(int) {
    if (countFile == nullptr) {
        return;
    }
    char digits[24];
    char* end = digits + sizeof digits;
    char* p = end;
    unsigned long long n = allocations.load(std::memory_order_relaxed);
    do {
        *--p = static_cast<char>('0' + n % 10);
        n /= 10;
    } while (n != 0);
    int fd = ::open(countFile, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd >= 0) {
        [[maybe_unused]] ssize_t written = ::write(fd, p, static_cast<std::size_t>(end - p));
        ::close(fd);
    }
}

__attribute__((constructor)) void install() {
    countFile = std::getenv("QM_ALLOCATION_COUNT_FILE");
    struct sigaction action{};
    action.sa_handler = writeCount;
    action.sa_flags = SA_RESTART;
    ::sigaction(SIGUSR2, &action, nullptr);
}

}  // namespace

extern "C" {

void* malloc(std::size_t size) {
    allocations.fetch_add(1, std::memory_order_relaxed);
    return __libc_malloc(size);
}

void* calloc(std::size_t count, std::size_t size) {
    allocations.fetch_add(1, std::memory_order_relaxed);
    return __libc_calloc(count, size);
}

void* realloc(void* pointer, std::size_t size) {
    allocations.fetch_add(1, std::memory_order_relaxed);
    return __libc_realloc(pointer, size);
}

int posix_memalign(void** result, std::size_t alignment, std::size_t size) {
    allocations.fetch_add(1, std::memory_order_relaxed);
    void* pointer = __libc_memalign(alignment, size);
    if (pointer == nullptr) {
        return ENOMEM;
    }
    *result = pointer;
    return 0;
}

void* aligned_alloc(std::size_t alignment, std::size_t size) {
    allocations.fetch_add(1, std::memory_order_relaxed);
    return __libc_memalign(alignment, size);
}

}  // extern "C"
