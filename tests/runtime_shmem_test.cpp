// Shared memory blocks and display buffers. Each case of shared memory runs in a child process with an IPC
// namespace of its own, since a process attaches the registry once.
#include "runtime/cmem.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include <csignal>
#include <sched.h>
#include <sys/mman.h>
#include <sys/shm.h>

#include "runtime/csys.h"
#include "runtime/logging.h"
#include "tests/support/log_daemon.h"
#include "tests/support/test_host.h"

// Replaces sleep(): nothing waits here, and a case may change something in the meantime.
static unsigned slept;
static std::function<void()> while_asleep;
extern "C" unsigned sleep(unsigned seconds) {
    slept += seconds;
    if (while_asleep)
        while_asleep();
    return 0;
}

namespace {

constexpr uint64_t BLOCK_BYTES = 10000; // 12288 in pages
constexpr key_t BLOCK_KEY = 0x12345;
constexpr size_t REGISTRY_BYTES = 361608;

// Runs `body` in a child process and returns its wait status: 0 if nothing failed.
int in_process(bool own_keys, const std::function<void()> &body) {
    return wait_for_child(start_child([&] {
        if (own_keys && unshare(CLONE_NEWIPC) != 0)
            return 99;
        body();
        return static_cast<int>(testing::Test::HasFailure());
    }));
}

#define IN_CHILD(...) ASSERT_EQ(in_process(true, [&]() __VA_ARGS__), 0)

// The bytes of the registry, which is created empty if it does not exist.
uint8_t *registry_bytes() {
    return static_cast<uint8_t *>(
        shmat(shmget(CMEM_REGISTRY_KEY, REGISTRY_BYTES, IPC_CREAT | 0777), nullptr, 0));
}
std::atomic<uint32_t> &registry_state() {
    return *reinterpret_cast<std::atomic<uint32_t> *>(registry_bytes() + 361600);
}
shmid_ds segment_of(key_t key) {
    shmid_ds status = {};
    EXPECT_EQ(shmctl(shmget(key, 0, 0), IPC_STAT, &status), 0);
    return status;
}
uint8_t *create_block(uint64_t length, const char *name) {
    return static_cast<uint8_t *>(cmem_create_block(length, name));
}

struct Blocks : testing::Test {
    log_daemon daemon;
    void SetUp() override {
        ASSERT_EQ(lc_log_init("shmem", nullptr, 0, 0x1060000, 7, 136, 1), LC_OK);
        (void)lc_log_set_daemon_log_level(7);
        std::ofstream(CMEM_CONF_PATH)
            << "# the blocks\n\nblock local normal 12345\nother\tinter\tnormal\t0x12346\n";
    }
    void TearDown() override { (void)lc_log_close(); }
    // Exactly one line was logged, and contains this text.
    testing::AssertionResult logged(const std::string &text) {
        const std::string line = daemon.one();
        return testing::AssertionResult(line.find(text) != std::string::npos) << line;
    }
    // A process of its own ends by abort() when it attaches the registry.
    void expect_abort(const std::function<void()> &prepare) {
        const int status = in_process(true, [&] {
            prepare();
            (void)cmem_attach_registry();
        });
        EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGABRT) << status;
        EXPECT_TRUE(logged("cmem_attach_registry: Cannot attach to shmem, err=Invalid argument\n"));
    }
};

TEST_F(Blocks, ANewBlockIsFoundByOthersAndInTheRegistry) {
    IN_CHILD({
        EXPECT_EQ(cmem_exists_block("block"), 0);
        uint8_t *block = create_block(BLOCK_BYTES, "block");
        ASSERT_NE(block, nullptr);
        EXPECT_TRUE(segment_of(BLOCK_KEY).shm_segsz == 12288 &&
                    (segment_of(BLOCK_KEY).shm_perm.mode & 0777) == 0777);
        block[12287] = 5;
        EXPECT_TRUE(cmem_exists_block("block") == 1 && cmem_exists_block("other") == 0);
        uint64_t length = 0;
        const auto *again = static_cast<uint8_t *>(cmem_attach_block("block", &length));
        EXPECT_TRUE(again && length == 12288 && again[12287] == 5);
        EXPECT_EQ(create_block(BLOCK_BYTES, "block"), nullptr);
        const std::string pid = std::to_string(getpid());
        EXPECT_TRUE(logged("cmem_create_block: double create attempt for memory block block, old pid=" + pid +
                           ", new pid=" + pid + "\n"));
        EXPECT_TRUE(!cmem_attach_block("nobody") &&
                    logged("cmem_attach_block: memory block nobody not found\n"));

        EXPECT_EQ(segment_of(CMEM_REGISTRY_KEY).shm_segsz, REGISTRY_BYTES);
        const uint8_t *bytes = registry_bytes();
        EXPECT_TRUE(memcmp(bytes, "block", 6) == 0 && memcmp(bytes + 336064, "other", 6) == 0);
        const auto pid_word = static_cast<uint32_t>(getpid());
        const std::pair<size_t, uint32_t> words[] = {
            {64, 12288}, {72, 4096}, {80, ~1u},          {84, 0x12345},          {112, pid_word},
            {156, 1},    {160, 1},   {336064 + 48, ~0u}, {336064 + 52, 0x12346}, {361600, 1}};
        for (const auto &[at, wanted] : words)
            EXPECT_EQ(memcmp(bytes + at, &wanted, sizeof wanted), 0) << at;
    });
}

TEST_F(Blocks, TheNextProcessTakesOverABlock) {
    IN_CHILD({
        EXPECT_EQ(in_process(false, [] { memset(create_block(BLOCK_BYTES, "block"), 0xff, 12288); }), 0);
        EXPECT_EQ(create_block(BLOCK_BYTES * 2, "block"), nullptr);
        EXPECT_TRUE(logged("length change attempt for memory block block, old len=12288, new len=20480\n"));
        const int id = shmget(BLOCK_KEY, 0, 0);
        const uint8_t *block = create_block(BLOCK_BYTES + 1, "block");
        ASSERT_TRUE(block && shmget(BLOCK_KEY, 0, 0) == id && std::count(block, block + 12288, 0) == 12288);
    });
    IN_CHILD({ // from a zombie, and from an earlier process with our process id
        const pid_t gone = start_child(
            [] { return create_block(BLOCK_BYTES, "block") && create_block(1, "other") ? 0 : 1; });
        siginfo_t info;
        ASSERT_EQ(waitid(P_PID, static_cast<id_t>(gone), &info, WEXITED | WNOWAIT), 0);
        EXPECT_NE(create_block(BLOCK_BYTES, "block"), nullptr);
        const int32_t pid = getpid();
        memcpy(registry_bytes() + 168 + 112, &pid, sizeof pid);
        EXPECT_TRUE(create_block(1, "other") && !create_block(1, "other")); // now it is ours
        (void)wait_for_child(gone);
    });
}

// Two processes create the same block at the same moment, alternately a new one and one whose creator has
// ended.
TEST_F(Blocks, OfTwoProcessesExactlyOneCreatesABlock) {
    constexpr int ROUNDS = 300;
    IN_CHILD({
        ASSERT_TRUE(cmem_attach_registry());
        (void)lc_log_set_daemon_log_level(0);           // a refusal is logged each time
        auto *counts = static_cast<std::atomic<int> *>( // ready, created, done
            mmap(nullptr, 4096, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
        const auto meet = [](std::atomic<int> *count) {
            for (++*count; *count < 2;)
                sched_yield();
        };
        int wrong = 0;
        for (int round = 0; round < ROUNDS; round++) {
            counts[0] = counts[1] = counts[2] = 0;
            for (int process = 0; process < 2; process++)
                start_child([&] {
                    meet(&counts[0]);
                    counts[1] += create_block(BLOCK_BYTES, "block") != nullptr;
                    meet(&counts[2]);
                    return 0;
                });
            while (wait(nullptr) > 0)
                continue;
            wrong += counts[1] != 1;
            if (round % 2 == 0)
                memset(registry_bytes(), 0, 336000);
        }
        EXPECT_EQ(wrong, 0);
    });
}

TEST_F(Blocks, ARegistryThatIsNotReady) {
    constexpr uint32_t EMPTY = 0, LOADING = 0xFFFFFFFF, READY = 1;
    IN_CHILD({ // the process that loads it has died
        registry_state() = LOADING;
        EXPECT_TRUE(!create_block(BLOCK_BYTES, "block") && slept == 5);
        EXPECT_TRUE(logged("cmem_attach_registry: the block registry has been loading for 5 seconds"));
        EXPECT_EQ(segment_of(CMEM_REGISTRY_KEY).shm_nattch, 1u); // the test's own
        // It finishes in time, or sets the registry back to empty.
        registry_state() = LOADING;
        while_asleep = [] { registry_state() = EMPTY; };
        EXPECT_TRUE(create_block(BLOCK_BYTES, "block") && registry_state() == READY);
    });
    expect_abort([] { registry_state() = 7; });
    IN_CHILD({ // the next process tries to read the file again
        const auto expect_unreadable = [&](const std::string &error) {
            EXPECT_EQ(in_process(false, [] { EXPECT_TRUE(cmem_attach_registry()); }), 0);
            EXPECT_TRUE(logged("cmem_load_conf: cannot read /etc/opt/rvl/mem.conf, err=" + error + "\n"));
        };
        std::filesystem::remove(CMEM_CONF_PATH);
        expect_unreadable("No such file or directory");
        std::filesystem::create_directory(CMEM_CONF_PATH);
        expect_unreadable("Is a directory");
        std::filesystem::remove(CMEM_CONF_PATH);
        std::ofstream(CMEM_CONF_PATH) << "block local normal 12345\n";
        EXPECT_NE(create_block(BLOCK_BYTES, "block"), nullptr);
    });
}

TEST_F(Blocks, ABlockOfAnotherSizeIsRefused) {
    IN_CHILD({
        ASSERT_TRUE(shmget(BLOCK_KEY, 4096, IPC_CREAT | 0777) >= 0 && !create_block(BLOCK_BYTES, "block"));
        EXPECT_TRUE(
            logged("cmem_create_block: cannot attach/shmget shared block block, length=12288, key=12345, "
                   "pagesize=4096, shmid=-1, err=Invalid argument, errno=22, check SHMMAX\n"));
        EXPECT_EQ(cmem_exists_block("block"), 0); // its record has been freed
        EXPECT_EQ(create_block(UINT64_MAX, "block"), nullptr);
        EXPECT_TRUE(logged("cannot attach/shmget shared block block"));
        // The segment of a block in the registry has been replaced by a shorter one.
        ASSERT_NE(create_block(BLOCK_BYTES, "other"), nullptr);
        EXPECT_TRUE(shmctl(shmget(0x12346, 0, 0), IPC_RMID, nullptr) == 0 && cmem_exists_block("other") == 0);
        EXPECT_TRUE(logged("cannot shmget to shared block other, err=No such file or directory\n"));
        ASSERT_TRUE(shmget(0x12346, 4096, IPC_CREAT | 0777) >= 0 && !cmem_attach_block("other"));
        EXPECT_TRUE(logged("cannot shmget shared block other, key=74566, err=Invalid argument\n"));
    });
    for (const size_t bytes : {size_t{8193}, size_t{BLOCK_BYTES}}) // enough in whole pages
        IN_CHILD({
            ASSERT_GE(shmget(BLOCK_KEY, bytes, IPC_CREAT | 0777), 0);
            uint64_t length = 0;
            EXPECT_TRUE(create_block(BLOCK_BYTES, "block") && cmem_attach_block("block", &length));
            EXPECT_EQ(length, 12288u);
        });
    for (const size_t bytes : {size_t{1}, REGISTRY_BYTES - 1}) // a registry that is too short
        expect_abort([&] { ASSERT_GE(shmget(CMEM_REGISTRY_KEY, bytes, IPC_CREAT | 0777), 0); });
}

TEST_F(Blocks, LinesOfTheConfiguration) {
    const std::string longest(31, 'n');
    std::ofstream conf(CMEM_CONF_PATH);
    conf << "bad 12 normal 1\n  # bad local normal 1\nbad\nworse inter enormous 1\n"
         << std::string(300, 'b') << " bad local normal 1\n"
         << longest
         << "cut local normal 2a\nregistry local normal beeffeed\nnokey local normal\n"
            "big local normal 123456789\nwords local normal 12x\nat 0 normal 77 300000000000\n";
    for (int i = 500; i < 1000; i++)
        conf << "many" << i << " local normal " << i << "\n";
    conf.close();
    IN_CHILD({
        EXPECT_TRUE(create_block(1, longest.c_str()) && shmget(0x2a, 0, 0) >= 0);
        std::string lines;
        for (const std::string &line : daemon.take())
            lines += line.substr(std::min(line.find("error parsing"), line.size()));
        EXPECT_EQ(
            lines,
            "error parsing affinity at line bad 12 normal 1\n\nerror parsing affinity at line bad\n\n"
            "error parsing page size at line worse inter enormous 1\n\nerror parsing affinity at line " +
                std::string(255, 'b') + "\n\n");
        for (const std::string name : {"bad", "worse", "registry", "nokey", "big", "words", "unlisted"}) {
            EXPECT_EQ(create_block(1, name.c_str()), nullptr);
            EXPECT_TRUE(logged("attempt to create shared block " + name + " conflicts with conf file\n"));
        }
        EXPECT_EQ(cmem_create_block(1, "at"), reinterpret_cast<void *>(0x300000000000));
        EXPECT_TRUE(create_block(1, "many800") && !create_block(1, "many999")); // the table is full
    });
}

// --- Display buffers

TEST(DisplayBuffer, HoldsWhatFits) {
    for (const uint32_t offset : {0u, 1u, 3u}) { // at any address
        const std::unique_ptr<char[]> memory(new char[1024 + offset]);
        csys_display_buf *buffer = csys_create_safe_display_buf_desc(memory.get() + offset, 1024);
        ASSERT_TRUE(buffer && csys_display_buf_bytes_max(buffer) == 991);
        const auto append = [&](const std::string &added) {
            return csys_append_to_safe_display_buf(buffer, added.c_str());
        };
        EXPECT_TRUE(append("") == 0 && append("abc") == 3);
        EXPECT_STREQ(csys_display_buf_text(buffer), "abc");
        EXPECT_EQ(append(std::string(1000, 'x')), 0u);
        EXPECT_EQ(csys_display_buf_text(buffer), "abc" + std::string(987, 'x') + "\n");
        EXPECT_TRUE(append("y") == 0 && csys_display_buf_bytes_used(buffer) == 991);
        buffer = csys_create_safe_display_buf_desc(memory.get() + offset, 1024);
        EXPECT_EQ(append(std::string(991, 'x')), 991u);
        EXPECT_EQ(csys_display_buf_text(buffer), std::string(991, 'x')); // full, but not cut
        memory[1024 + offset - 32] ^= 1;
        EXPECT_TRUE(csys_chk_display_buf(buffer) == 1 && append("y") == 0);
    }
    char small[33];
    EXPECT_EQ(csys_create_safe_display_buf_desc(small, 32), nullptr);
    csys_display_buf *buffer = csys_create_safe_display_buf_desc(small, 33);
    ASSERT_TRUE(buffer && csys_append_to_safe_display_buf(buffer, "x") == 0 &&
                !*csys_display_buf_text(buffer));
}

} // namespace
