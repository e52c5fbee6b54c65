#include "TlsEnds.hpp"

#include <atomic>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <malloc.h>
#include <memory>
#include <new>
#include <openssl/crypto.h>
#include <vector>

/// @file
/// What a TLS connection costs in memory: the heap of one end after the handshake, and the allocations of a connection
/// that carries data. A program of its own, because it counts every allocation of the process. Nothing here passes or
/// fails: the figures are for people.

namespace {

/// What one owner has on the heap. Plain data: it is used before any initialiser has run.
struct Heap {
    std::atomic<std::size_t> allocations;
    std::atomic<std::ptrdiff_t> bytes; // as the allocator rounds them

    void* taken(void* block)
    {
        if (block == nullptr) return nullptr;
        allocations.fetch_add(1, std::memory_order_relaxed);
        bytes.fetch_add(static_cast<std::ptrdiff_t>(::malloc_usable_size(block)), std::memory_order_relaxed);
        return block;
    }
    void given(void* block)
    {
        bytes.fetch_sub(static_cast<std::ptrdiff_t>(::malloc_usable_size(block)), std::memory_order_relaxed);
    }
};

Heap sOurs;    // operator new: the library, and the C++ runtime for it
Heap sOpenSSL; // CRYPTO_malloc and its relatives

void* cryptoMalloc(std::size_t size, const char*, int) { return sOpenSSL.taken(std::malloc(size)); }

void* cryptoRealloc(void* block, std::size_t size, const char*, int)
{
    sOpenSSL.given(block);
    return sOpenSSL.taken(std::realloc(block, size));
}

void cryptoFree(void* block, const char*, int)
{
    sOpenSSL.given(block);
    std::free(block);
}

void* allocate(std::size_t size)
{
    void* const block = sOurs.taken(std::malloc(size != 0 ? size : 1));
    if (block == nullptr) throw std::bad_alloc();
    return block;
}

void release(void* block) noexcept
{
    sOurs.given(block);
    std::free(block);
}

} // namespace

void* operator new(std::size_t size) { return allocate(size); }
void* operator new[](std::size_t size) { return allocate(size); }
void operator delete(void* block) noexcept { release(block); }
void operator delete[](void* block) noexcept { release(block); }
void operator delete(void* block, std::size_t) noexcept { release(block); }
void operator delete[](void* block, std::size_t) noexcept { release(block); }

namespace qel::bench {

namespace {

constexpr std::size_t kConnections = 8;
constexpr double kEnds = 2 * kConnections;
constexpr double kKibibyte = 1024;

struct Bytes {
    double ours;
    double openssl;
};

Bytes onTheHeap() { return {static_cast<double>(sOurs.bytes), static_cast<double>(sOpenSSL.bytes)}; }

/// @param connect  makes one connection, both ends, and does its handshake
/// @return the bytes of one end
template <typename Connect>
Bytes bytesPerEnd(const Connect& connect)
{
    connect(); // whatever is made once and stays has been made by now
    std::vector<decltype(connect())> connections;
    connections.reserve(kConnections);
    const Bytes before = onTheHeap();
    for (std::size_t i = 0; i < kConnections; ++i)
        connections.push_back(connect());
    const Bytes after = onTheHeap();
    return {(after.ours - before.ours) / kEnds, (after.openssl - before.openssl) / kEnds};
}

void printRow(const char* work, double value, const char* unit, double atMost)
{
    const char* const verdict = value <= atMost ? "reached" : "MISSED";
    std::printf("%-76s %10.1f %-12s %7.0f  %s\n", work, value, unit, atMost, verdict);
}

void printRow(const char* work, double value, const char* unit)
{
    std::printf("%-76s %10.1f %-12s %7s\n", work, value, unit, "-");
}

void heapOfAnEnd()
{
    OurContexts ourContexts;
    const Bytes ours = bytesPerEnd([&] {
        auto connection = std::make_unique<OurTlsPair>(ourContexts, TcpPair());
        connection->handshake();
        return connection;
    });

    struct Raw {
        explicit Raw(const RawContexts& contexts) : tls(contexts, pair) { tls.handshake(); }
        TcpPair pair;
        RawTlsPair tls;
    };
    const RawContexts rawContexts;
    const Bytes raw = bytesPerEnd([&] { return std::make_unique<Raw>(rawContexts); });

    printRow("TLS: heap of one end after the handshake", (ours.ours + ours.openssl) / kKibibyte, "KiB", 80);
    printRow("TLS: OpenSSL's part of it", ours.openssl / kKibibyte, "KiB");
    printRow("TLS: the same, OpenSSL on the descriptor", (raw.ours + raw.openssl) / kKibibyte, "KiB");
}

void allocationsInFlight()
{
    constexpr int kRounds = 1000;
    OurContexts contexts;
    OurTlsPair connection(contexts, TcpPair());
    connection.handshake();
    std::vector<char> data(QelMessage::MtuMax, 'x');
    const auto pass = [&](std::size_t length) {
        connection.near->write(data.data(), length);
        connection.far->fill(data.data(), length);
    };
    constexpr std::size_t kLengths[] = {64, 1024, 4096, QelMessage::MtuMax};
    const auto passAll = [&] {
        for (const std::size_t length : kLengths)
            pass(length);
    };

    passAll();
    const std::size_t ours = sOurs.allocations;
    const std::size_t openssl = sOpenSSL.allocations;
    for (int i = 0; i < kRounds; ++i)
        passAll();
    const double transfers = 4.0 * kRounds;
    printRow("TLS: our allocations in 4000 transfers of 64 B to 16 KiB", static_cast<double>(sOurs.allocations - ours),
             "allocations", 0);
    printRow("TLS: OpenSSL's in each of them", static_cast<double>(sOpenSSL.allocations - openssl) / transfers,
             "allocations");
}

} // namespace

} // namespace qel::bench

int main()
{
    qel::bench::checkCall(CRYPTO_set_mem_functions(cryptoMalloc, cryptoRealloc, cryptoFree) == 1,
                          "CRYPTO_set_mem_functions"); // works only before OpenSSL has allocated anything
    std::printf("\n%-76s %10s %-12s %7s\n", "memory", "", "", "at most");
    qel::bench::heapOfAnEnd();
    qel::bench::allocationsInFlight();
    return EXIT_SUCCESS;
}
