// Named blocks of System V shared memory and their registry.
//
// The registry is a segment that other programs of the platform use as well; therefore its layout is fixed:
// 2000 block records, 400 entries of "mem.conf" and a state word. The first process changes the state from
// empty to loading by compare-and-swap, loads the file and sets it to ready, or back to empty if the file
// couldn't be read; other processes wait for it. A registry that can't be attached ends the process; every
// other failure is logged and returned.
//
// A System V semaphore with the registry's key serialises the creation of blocks. It is 0 while it is free;
// SEM_UNDO makes the kernel release it if its holder dies. A free record is claimed by compare-and-swap all
// the same, because the platform's other programs don't use the semaphore.
//
// A key may belong to a segment of another size that somebody else has created. Its size is therefore checked
// before a byte of it is used. A segment that is too short for its block, or for the registry, is treated as
// one that can't be attached, as is a registry with an unknown state.
#include "runtime/cmem.h"

#include <atomic>
#include <cctype>
#include <cerrno>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <fcntl.h>
#include <numa.h>
#include <signal.h>
#include <sys/sem.h>
#include <sys/shm.h>
#include <unistd.h>

#include "runtime/common.h"
#include "runtime/guards.h"
#include "runtime/logging.h"

constexpr uint32_t MAX_BLOCKS = 2000;
constexpr uint32_t MAX_CONF = 400;
constexpr uint32_t NAME_BYTES = 32;
constexpr size_t CONF_LINE_BYTES = 256;
constexpr uint64_t NORMAL_PAGE = 4096;
constexpr uint64_t HUGE_PAGE_BYTES = 0x200000;
constexpr int SHARED_MODE = 0777;
constexpr unsigned WAIT_SECONDS = 5; // for another process that is loading the registry or creating a block
enum : int32_t { NODE_LOCAL = -2, NODE_INTERLEAVED = -1 };
enum : uint32_t { REGISTRY_EMPTY = 0, REGISTRY_LOADING = 0xFFFFFFFF, REGISTRY_READY = 1 };

struct cmem_block {
    char name[NAME_BYTES];
    char owner[NAME_BYTES]; // program, for diagnostics
    uint64_t length;        // rounded up to the page size
    uint64_t page_size;
    int32_t node;
    uint32_t key;
    uint64_t zero;
    uint64_t attach_address; // requested by mem.conf, 0 for any
    uint64_t creator_address;
    std::atomic<int32_t> pid; // of the creator
    uint32_t alignment;
    uint64_t counters[4];
    uint32_t diagnostic;
    uint32_t configured; // 1: mem.conf has an entry for it
    std::atomic<uint32_t> in_use;
    uint32_t tail;
};
struct cmem_conf {
    char name[NAME_BYTES];
    uint64_t page_size;
    uint64_t attach_address;
    int32_t node;
    uint32_t key;
    uint64_t zero;
};
struct cmem_registry {
    cmem_block blocks[MAX_BLOCKS];
    cmem_conf conf[MAX_CONF];
    std::atomic<uint32_t> state;
    uint32_t tail;
};
static_assert(sizeof(cmem_block) == 168 && offsetof(cmem_block, owner) == 32 &&
              offsetof(cmem_block, length) == 64);
static_assert(offsetof(cmem_block, page_size) == 72 && offsetof(cmem_block, node) == 80);
static_assert(offsetof(cmem_block, key) == 84 && offsetof(cmem_block, zero) == 88);
static_assert(offsetof(cmem_block, attach_address) == 96 && offsetof(cmem_block, creator_address) == 104);
static_assert(offsetof(cmem_block, pid) == 112 && offsetof(cmem_block, counters) == 120);
static_assert(offsetof(cmem_block, diagnostic) == 152 && offsetof(cmem_block, configured) == 156);
static_assert(offsetof(cmem_block, in_use) == 160);
static_assert(sizeof(cmem_conf) == 64 && offsetof(cmem_conf, page_size) == 32);
static_assert(offsetof(cmem_conf, attach_address) == 40 && offsetof(cmem_conf, node) == 48);
static_assert(offsetof(cmem_conf, key) == 52 && offsetof(cmem_conf, zero) == 56);
static_assert(offsetof(cmem_registry, conf) == 336000 && offsetof(cmem_registry, state) == 361600);
static_assert(sizeof(cmem_registry) == 361608);

namespace {

cmem_registry *registry;
bool created_here[MAX_BLOCKS]; // by this process, or by the one from which it was forked
pthread_mutex_t registry_lock = PTHREAD_MUTEX_INITIALIZER;

// To a multiple of `page`, without overflow.
uint64_t round_up(uint64_t length, uint64_t page) {
    return length > UINT64_MAX - page ? UINT64_MAX / page * page : (length + page - 1) / page * page;
}

// --- mem.conf

bool parse_node(const char *word, int32_t *out) {
    if (strcmp(word, "inter") == 0)
        *out = NODE_INTERLEAVED;
    else if (strcmp(word, "local") == 0)
        *out = NODE_LOCAL;
    else if (isdigit(static_cast<unsigned char>(word[0])) && word[1] == '\0')
        *out = word[0] - '0';
    else
        return false;
    return true;
}

bool huge_pages_supported() {
    return access("/sys/kernel/mm/hugepages/hugepages-2048kB", F_OK) == 0;
}

bool parse_page_size(const char *word, uint64_t *out) {
    if (strcmp(word, "normal") == 0)
        *out = NORMAL_PAGE;
    else if (strcmp(word, "huge") == 0)
        *out = huge_pages_supported() ? HUGE_PAGE_BYTES : NORMAL_PAGE;
    else
        return false;
    return true;
}

// The next word of a line, which is ended with a NUL in place; an empty word at the end of the line.
char *next_word(char **inout_text) {
    char *word = *inout_text + strspn(*inout_text, " \t");
    char *end = word + strcspn(word, " \t");
    *inout_text = *end ? end + 1 : end;
    *end = '\0';
    return word;
}

// A hexadecimal number of at most `limit`; 0, which means no key and no address, for anything else.
uint64_t parse_hex(const char *word, uint64_t limit) {
    char *end = nullptr;
    errno = 0;
    // strtoull would accept a minus sign and wrap the number around.
    const unsigned long long number = strtoull(word, &end, 16);
    return errno == 0 && *end == '\0' && word[0] != '-' && number <= limit ? number : 0;
}

// False for a line that is ignored; `out_wrong` is the reason, or null for a comment or an empty line.
bool parse_conf_line(char *line, cmem_conf *out, const char **out_wrong) {
    *out_wrong = nullptr;
    const char *name = next_word(&line);
    if (name[0] == '#' || name[0] == '\0')
        // The name is cut to what a record can hold; block names are compared by as many characters.
        return false;
    *out = {};
    memcpy(out->name, name, strnlen(name, NAME_BYTES - 1));
    if (!parse_node(next_word(&line), &out->node))
        *out_wrong = "affinity";
    else if (!parse_page_size(next_word(&line), &out->page_size))
        *out_wrong = "page size";
    if (*out_wrong)
        return false;
    out->key = static_cast<uint32_t>(parse_hex(next_word(&line), UINT32_MAX));
    if (out->key == static_cast<uint32_t>(CMEM_REGISTRY_KEY))
        out->key = 0; // creating the block would zero the registry
    out->attach_address = parse_hex(next_word(&line), UINT64_MAX);
    return true;
}

// Calls take(entry) for each valid line until that returns false, and fail(reason, line, line number) for
// each invalid one. Returns 0, or the errno if the file can't be read.
template <typename Take, typename Fail>
int read_conf(const char *path, const Take &take, const Fail &fail) {
    FILE *file = fopen(path, "re");
    char line[CONF_LINE_BYTES], whole[CONF_LINE_BYTES];
    cmem_conf entry;
    bool inside = false; // a line that is longer than the buffer: its rest is skipped
    bool more = true;
    for (uint32_t number = 0; file && more && fgets(line, sizeof line, file);) {
        const bool rest = inside;
        char *end = strpbrk(line, "\r\n");
        // A last line without a newline is shorter than the buffer, and therefore complete.
        inside = !end && strlen(line) == sizeof line - 1;
        if (end)
            *end = '\0';
        if (rest)
            continue;
        number++;
        strlcpy(whole, line, sizeof whole); // parsing cuts the line into words
        const char *wrong = nullptr;
        if (parse_conf_line(line, &entry, &wrong))
            more = take(entry);
        else if (wrong)
            fail(wrong, whole, number);
    }
    const int error = !file || ferror(file) ? errno : 0;
    if (file)
        fclose(file);
    return error;
}

// Loads mem.conf into a registry whose state is loading. False, logged, if the file can't be read; no entry
// is then set.
bool load_conf(cmem_registry *fresh) {
    uint32_t count = 0;
    const int error = read_conf(
        CMEM_CONF_PATH,
        [&](const cmem_conf &entry) {
            fresh->conf[count++] = entry;
            return count < MAX_CONF;
        },
        [](const char *wrong, const char *line, uint32_t) {
            QV_LOG(LC_LOG_ERR, "%s: error parsing %s at line %s\n", "cmem_load_conf", wrong, line);
        });
    if (error) {
        QV_LOG(LC_LOG_ERR, "%s: cannot read %s, err=%s\n", "cmem_load_conf", CMEM_CONF_PATH, strerror(error));
        // Entries from before the error are dropped; the next process reads the file from its start.
        memset(static_cast<void *>(fresh->conf), 0, sizeof fresh->conf);
    }
    return error == 0;
}

} // namespace

cmem_conf_faults cmem_check_conf(const char *path, const char *name) {
    cmem_conf_faults faults = {};
    bool found = false; // the first entry with the name counts, as in find_conf
    uint32_t count = 0;
    faults.error = read_conf(
        path,
        [&](const cmem_conf &entry) {
            if (!found && strcmp(entry.name, name) == 0) {
                found = true;
                faults.has_key = entry.key != 0;
            }
            return ++count < MAX_CONF;
        },
        [&](const char *, const char *, uint32_t number) {
            if (faults.bad_line == 0)
                faults.bad_line = number;
        });
    return faults;
}

// --- The registry

namespace {

// The usable bytes of a segment, which consists of whole pages; 0 if it can't be queried.
uint64_t segment_bytes(int id) {
    shmid_ds status = {};
    return shmctl(id, IPC_STAT, &status) == 0 ? round_up(status.shm_segsz, NORMAL_PAGE) : 0;
}

[[noreturn]] void attach_failed() {
    QV_LOG(LC_LOG_ERR, "%s: Cannot attach to shmem, err=%s\n", "cmem_attach_registry", strerror(errno));
    abort();
}

// Loads the configuration into the registry, or waits for the process that is loading it. False, logged, if
// that process doesn't finish. If this process can't read the file, the next one tries again.
bool fill_registry(cmem_registry *fresh) {
    for (unsigned waited = 0;; waited++) {
        uint32_t state = REGISTRY_EMPTY;
        // The kernel fills a new segment with zeros, which is the state "empty"; one process wins the
        // exchange.
        if (fresh->state.compare_exchange_strong(state, REGISTRY_LOADING)) {
            fresh->state = load_conf(fresh) ? REGISTRY_READY : REGISTRY_EMPTY;
            return true;
        }
        if (state == REGISTRY_READY)
            return true;
        // Not a state of ours: the segment belongs to something else that uses the same key.
        if (state != REGISTRY_LOADING) {
            errno = EINVAL;
            attach_failed();
        }
        if (waited == WAIT_SECONDS)
            break;
        sleep(1);
    }
    const auto key = static_cast<uint32_t>(CMEM_REGISTRY_KEY);
    QV_LOG(
        LC_LOG_ERR,
        "%s: the block registry has been loading for %u seconds: the process that is loading it hangs or has "
        "died. Remove the registry with \"ipcrm -M 0x%x\" when no program is using it\n",
        "cmem_attach_registry", WAIT_SECONDS, key);
    return false;
}

cmem_registry *attach_registry() {
    const mutex_guard guard(&registry_lock);
    if (registry)
        return registry;
    // A segment that exists already and is too short gives EINVAL.
    const int id = shmget(CMEM_REGISTRY_KEY, sizeof(cmem_registry), IPC_CREAT | SHARED_MODE);
    void *memory = id >= 0 ? shmat(id, nullptr, 0) : reinterpret_cast<void *>(-1);
    if (memory == reinterpret_cast<void *>(-1))
        attach_failed();
    cmem_registry *attached = static_cast<cmem_registry *>(memory);
    // `registry` stays null while another process is stuck in loading; the next call waits again.
    if (fill_registry(attached))
        registry = attached;
    else
        shmdt(memory);
    return registry;
}

} // namespace

bool cmem_attach_registry() {
    const cancel_off_guard uncancelled;
    return attach_registry() != nullptr;
}

namespace {

cmem_block *find_block(cmem_registry *known, const char *name) {
    for (cmem_block &block : known->blocks)
        // A claimed record whose name isn't written yet has an empty one, which no caller may ask for.
        if (block.in_use && strncmp(block.name, name, NAME_BYTES - 1) == 0)
            return &block;
    return nullptr;
}

cmem_block *claim_block(cmem_registry *known) {
    for (cmem_block &block : known->blocks) {
        uint32_t expected = 0;
        if (block.in_use.compare_exchange_strong(expected, 1))
            return &block;
    }
    return nullptr;
}

void free_block(cmem_block *block) {
    // In this order: once the record is free, another process may claim it and write its own name.
    memset(block->name, 0, sizeof block->name);
    block->in_use = 0;
}

// Whether the process has ended but has not been waited for. Its files in /proc still exist.
bool is_zombie(int32_t pid) {
    char path[64], text[256] = {};
    snprintf(path, sizeof path, "/proc/%d/stat", pid);
    const int fd = open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0)
        return false;
    const ssize_t length = read(fd, text, sizeof text - 1);
    close(fd);
    // "pid (name) state ...", and the name may itself contain a parenthesis.
    const char *name_end = length > 0 ? strrchr(text, ')') : nullptr;
    return name_end && (strncmp(name_end, ") Z", 3) == 0 || strncmp(name_end, ") X", 3) == 0);
}

// Whether the creator of a block is still running. A process exists if it has a numa_maps file, or on a
// kernel without those, if it can be signalled. A record with our own process id which we didn't create is
// from an earlier process that had the same id.
bool creator_lives(const cmem_registry *known, const cmem_block *block) {
    const int32_t pid = block->pid;
    if (pid == getpid())
        return created_here[block - known->blocks];
    char path[64];
    snprintf(path, sizeof path, "/proc/%d/numa_maps", pid);
    const int fd = open(path, O_RDONLY | O_CLOEXEC);
    if (fd >= 0)
        close(fd);
    const bool exists =
        fd >= 0 || (access("/proc/self/numa_maps", F_OK) != 0 && pid > 0 && kill(pid, 0) == 0);
    return exists && !is_zombie(pid);
}

const cmem_conf *find_conf(const cmem_registry *known, const char *name) {
    for (const cmem_conf &entry : known->conf)
        if (entry.name[0] && strncmp(entry.name, name, NAME_BYTES - 1) == 0)
            return &entry;
    return nullptr;
}

// Fills a record that this process has claimed.
void fill_block_record(cmem_block *block, const cmem_registry *known, const char *name, uint64_t length) {
    static const cmem_conf unlisted = {{}, NORMAL_PAGE, 0, NODE_LOCAL, 0, 0};
    const cmem_conf *entry = find_conf(known, name);
    block->configured = entry != nullptr;
    if (!entry)
        entry = &unlisted;
    block->length = round_up(length, entry->page_size);
    block->page_size = entry->page_size;
    block->node = entry->node;
    block->key = entry->key;
    block->zero = 0;
    block->attach_address = entry->attach_address;
    block->creator_address = 0;
    block->pid = getpid();
    memset(block->counters, 0, sizeof block->counters);
    block->diagnostic = 0;
    strlcpy(block->owner, program_invocation_short_name, sizeof block->owner);
    // The name is written last, and its first byte after the others: a process that finds the name, without
    // any lock, finds the record complete. A record that is taken over has its name already, but also the
    // same size and key as before.
    strlcpy(block->name + 1, name + 1, sizeof block->name - 1);
    __atomic_store_n(&block->name[0], name[0], __ATOMIC_RELEASE);
}

// The record for a name, either a free one or that of a creator that has ended; null, logged, if there is
// none.
cmem_block *take_block(cmem_registry *known, const char *name, uint64_t length) {
    cmem_block *block = find_block(known, name);
    if (!block) {
        block = claim_block(known);
        if (!block)
            QV_LOG(LC_LOG_ERR, "%s: out of memory tracking blocks\n", "cmem_create_block");
        return block;
    }
    // A second creator would zero the data that the first one is using.
    if (creator_lives(known, block)) {
        QV_LOG(LC_LOG_ERR, "%s: double create attempt for memory block %s, old pid=%d, new pid=%d\n",
               "cmem_create_block", name, block->pid.load(), getpid());
        return nullptr;
    }
    // Other programs write to the registry too, and a page size of 0 would divide by zero.
    const uint64_t rounded = round_up(length, block->page_size ? block->page_size : NORMAL_PAGE);
    // The new size can't be had by taking the record over: the old segment keeps its size, and others may
    // still have it attached.
    if (rounded != block->length) {
        QV_LOG(LC_LOG_NOTICE, "%s: length change attempt for memory block %s, old len=%lu, new len=%lu\n",
               "cmem_create_block", name, static_cast<unsigned long>(block->length),
               static_cast<unsigned long>(rounded));
        return nullptr;
    }
    return block;
}

// The semaphore, from the search for a name until its record is filled.
struct creation_lock {
    creation_lock() : id(semget(CMEM_REGISTRY_KEY, 1, IPC_CREAT | SHARED_MODE)) {
        sembuf take[] = {{.sem_num = 0, .sem_op = 0, .sem_flg = 0},
                         {.sem_num = 0, .sem_op = 1, .sem_flg = SEM_UNDO}};
        // Both steps are one atomic operation: wait for 0, and add 1.
        const timespec limit = {WAIT_SECONDS, 0};
        int result;
        // If semget failed, the id is -1 and this fails with EINVAL. After the time limit it is EAGAIN.
        do
            result = semtimedop(id, take, 2, &limit);
        while (result != 0 && errno == EINTR);
        held = result == 0;
    }
    ~creation_lock() {
        // SEM_UNDO here as well: it cancels the adjustment that the kernel has kept since the lock was taken.
        sembuf release = {.sem_num = 0, .sem_op = -1, .sem_flg = SEM_UNDO | IPC_NOWAIT};
        if (held)
            semop(id, &release, 1);
    }
    creation_lock(const creation_lock &) = delete;
    creation_lock &operator=(const creation_lock &) = delete;
    int id;
    bool held;
};

// The filled record of a block that this process may create; null, logged, if it may not.
cmem_block *claim_name(cmem_registry *known, const char *name, uint64_t length) {
    const creation_lock lock;
    if (!lock.held) {
        QV_LOG(LC_LOG_ERR, "%s: cannot lock the registry for memory block %s, err=%s\n", "cmem_create_block",
               name, strerror(errno));
        return nullptr;
    }
    cmem_block *block = take_block(known, name, length);
    if (!block)
        return nullptr;
    fill_block_record(block, known, name, length);
    created_here[block - known->blocks] = true;
    return block;
}

void place_on_node(void *memory, const cmem_block *block) {
    // Without NUMA, or without that node, the kernel's own placement is good enough.
    if (numa_available() < 0)
        return;
    if (block->node > numa_max_node())
        return;
    if (block->node >= 0)
        numa_tonode_memory(memory, block->length, block->node);
    else if (block->node == NODE_LOCAL)
        numa_setlocal_memory(memory, block->length);
    else
        numa_interleave_memory(memory, block->length, numa_all_nodes_ptr);
}

} // namespace

int32_t cmem_find_creator(const char *name, bool *out_lives) {
    *out_lives = false;
    const cmem_registry *known = registry;
    const cmem_block *block = known ? find_block(registry, name) : nullptr;
    if (!block)
        return 0;
    *out_lives = creator_lives(known, block);
    return block->pid;
}

void *cmem_create_block(uint64_t length, const char *name) {
    if (!name || !*name)
        return nullptr;
    const cancel_off_guard uncancelled;
    cmem_registry *known = attach_registry();
    cmem_block *block = known ? claim_name(known, name, length) : nullptr;
    if (!block)
        return nullptr;
    if (block->key == 0) {
        QV_LOG(LC_LOG_ERR, "%s: attempt to create shared block %s conflicts with conf file\n", __func__,
               name);
        free_block(block);
        return nullptr;
    }
    const int key = static_cast<int>(block->key);
    // With size 0 an existing segment is found whatever its size. Segments are never removed: other programs
    // may have this one attached, and a restarted creator uses it again.
    int id = shmget(key, 0, 0);
    const bool fresh = id < 0;
    if (fresh)
        id = shmget(key, block->length,
                    IPC_CREAT | SHARED_MODE | (block->page_size > NORMAL_PAGE ? SHM_HUGETLB : 0));
    else if (segment_bytes(id) < block->length) {
        errno = EINVAL;
        id = -1;
    }
    if (id < 0) {
        QV_LOG(
            LC_LOG_ERR,
            "%s: cannot attach/shmget shared block %s, length=%ld, key=%x, pagesize=%ld, shmid=%d, err=%s, "
            "errno=%d, check SHMMAX\n",
            __func__, name, static_cast<long>(block->length), block->key, static_cast<long>(block->page_size),
            id, strerror(errno), errno);
        free_block(block);
        return nullptr;
    }
    void *memory = shmat(id, reinterpret_cast<const void *>(block->attach_address), 0);
    if (memory == reinterpret_cast<void *>(-1)) {
        QV_LOG(LC_LOG_ERR, "%s: cannot attach/shmat shared block %s, length=%ld, shmid=%d, err=%s\n",
               __func__, name, static_cast<long>(block->length), id, strerror(errno));
        free_block(block);
        return nullptr;
    }
    block->creator_address = reinterpret_cast<uint64_t>(memory);
    // Before the block is zeroed: the policy applies to pages that haven't been touched yet.
    if (fresh)
        place_on_node(memory, block);
    // A new segment is zero already; one that outlived its creator isn't.
    memset(memory, 0, block->length);
    return memory;
}

int cmem_exists_block(const char *name) {
    const cancel_off_guard uncancelled;
    cmem_registry *known = nullptr;
    {
        const mutex_guard guard(&registry_lock);
        known = registry;
    }
    if (!known || !name || !*name)
        return 0;
    const cmem_block *block = find_block(known, name);
    if (!block)
        return 0;
    // The record outlives the segment if somebody removes that by hand.
    if (shmget(static_cast<int>(block->key), 0, 0) < 0) {
        QV_LOG(LC_LOG_ERR, "%s: cannot shmget to shared block %s, err=%s\n", __func__, name, strerror(errno));
        return 0;
    }
    return 1;
}

void *cmem_attach_block(const char *name, uint64_t *out_length) {
    const cancel_off_guard uncancelled;
    if (out_length)
        *out_length = 0;
    cmem_registry *known = attach_registry();
    if (!known)
        return nullptr;
    const cmem_block *block = name && *name ? find_block(known, name) : nullptr;
    if (!block) {
        QV_LOG(LC_LOG_WARNING, "%s: memory block %s not found\n", __func__, name ? name : "");
        return nullptr;
    }
    if (block->key == 0) {
        QV_LOG(LC_LOG_ERR, "%s: memory block %s is not shared\n", __func__, name);
        return nullptr;
    }
    int id = shmget(static_cast<int>(block->key), 0, 0);
    const uint64_t held = id >= 0 ? segment_bytes(id) : 0;
    // A segment shorter than its record says has been replaced by somebody else.
    if (id >= 0 && (held == 0 || held < block->length)) {
        errno = EINVAL;
        id = -1;
    }
    if (id < 0) {
        QV_LOG(LC_LOG_WARNING, "%s: cannot shmget shared block %s, key=%u, err=%s\n", __func__, name,
               block->key, strerror(errno));
        return nullptr;
    }
    const void *address = reinterpret_cast<const void *>(block->attach_address);
    void *memory = shmat(id, address, 0);
    if (memory == reinterpret_cast<void *>(-1)) {
        QV_LOG(LC_LOG_WARNING,
               "%s: cannot attach to shared block %s, err=%s, shmid=%x, p->addr=%p, shmflag=%x\n", __func__,
               name, strerror(errno), static_cast<unsigned>(id), address, 0U);
        return nullptr;
    }
    // The real size, which is what the caller may touch; the record is only what somebody wrote.
    if (out_length)
        *out_length = held;
    return memory;
}

// --- Mutexes

struct cmutex {
    char name[NAME_BYTES];
    pthread_mutex_t mutex;
};

cmutex *cmutex_alloc(const char *name) {
    cmutex *mutex = static_cast<cmutex *>(calloc(1, sizeof *mutex));
    if (!mutex)
        return nullptr;
    strlcpy(mutex->name, name ? name : "", sizeof mutex->name);
    pthread_mutex_init(&mutex->mutex, nullptr);
    return mutex;
}
void cmutex_free(cmutex **inout_mutex) {
    if (!inout_mutex || !*inout_mutex)
        return;
    pthread_mutex_destroy(&(*inout_mutex)->mutex);
    free(*inout_mutex);
    *inout_mutex = nullptr;
}
int cmutex_lock(cmutex *mutex) {
    return mutex ? pthread_mutex_lock(&mutex->mutex) : 1;
}
int cmutex_unlock(cmutex *mutex) {
    return mutex ? pthread_mutex_unlock(&mutex->mutex) : 1;
}
