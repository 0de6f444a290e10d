// Children that one thread waits for while another may trace and reap them.
#include "util/children.h"

#include <errno.h>
#include <pthread.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <atomic>

#include "util/clock.h"

namespace {

// A child until it has been waited for. A pid may stand in the list twice, when its number is used
// again before its status was fetched: the older one comes first and is served first.
struct ChildEntry {
    ChildEntry *next;
    pid_t pid;
    pid_t tracer;  // the thread that has claimed it, or 0
    bool ended;    // and reaped, with
    int status;    // as its wait status
};

pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;  // of the list
pthread_cond_t changed = PTHREAD_COND_INITIALIZER;  // an entry was released, or its child reaped
ChildEntry *entries;

// Threads inside wait_as_tracer. A child can be gone and its status not here yet only meanwhile.
std::atomic<int> waiting_tracers;

// How often and for how long a waiter looks for the status of a child that is gone. A tracer
// delivers it in an instant; it never comes when the end was taken by anyone else, such as the
// kernel where SIGCHLD is ignored.
constexpr long STATUS_POLL_MS = 1;
constexpr int64_t STATUS_PATIENCE_MS = 5000;

// Between two looks at a child with a stop that is for a tracer who has not claimed it.
constexpr long STOP_POLL_MS = 20;

struct Lock {
    Lock() { (void)pthread_mutex_lock(&mutex); }
    ~Lock() { (void)pthread_mutex_unlock(&mutex); }
    Lock(const Lock &) = delete;
    Lock &operator=(const Lock &) = delete;
};

pid_t this_thread() {
    return static_cast<pid_t>(syscall(SYS_gettid));
}

void sleep_ms(long milliseconds) {
    timespec time = {.tv_sec = 0, .tv_nsec = milliseconds * 1000000};
    (void)nanosleep(&time, nullptr);
}

bool has_ended(int status) {
    return WIFEXITED(status) || WIFSIGNALED(status);
}

// ---- The list, with the lock held ----

ChildEntry *find(pid_t pid) {
    ChildEntry *entry = entries;
    while (entry != nullptr && entry->pid != pid)
        entry = entry->next;
    return entry;
}

ChildEntry *find_running(pid_t pid) {
    ChildEntry *entry = entries;
    while (entry != nullptr && (entry->pid != pid || entry->ended))
        entry = entry->next;
    return entry;
}

void append(ChildEntry *entry) {
    ChildEntry **end = &entries;
    while (*end != nullptr)
        end = &(*end)->next;
    *end = entry;
}

void remove(ChildEntry *entry) {
    ChildEntry **link = &entries;
    while (*link != entry)
        link = &(*link)->next;
    *link = entry->next;
    free(entry);
}

ChildEntry *make_entry(pid_t pid) {
    ChildEntry *entry = static_cast<ChildEntry *>(calloc(1, sizeof(ChildEntry)));
    if (entry == nullptr)
        return nullptr;
    entry->pid = pid;
    append(entry);
    return entry;
}

// ---- Steps of a wait ----

enum class Wait { DONE, FREE, OWN_TRACEE, GONE };

// Waits while another thread traces the child. DONE: its status was here.
Wait await_tracer(pid_t pid, int *status) {
    Lock lock;
    for (;;) {
        ChildEntry *entry = find(pid);
        // A child that was forked in another way is known from the first wait for it on.
        if (entry == nullptr && (entry = make_entry(pid)) == nullptr)
            return Wait::GONE;
        if (entry->ended) {
            *status = entry->status;
            remove(entry);
            return Wait::DONE;
        }
        if (entry->tracer == 0)
            return Wait::FREE;
        if (entry->tracer == this_thread())
            return Wait::OWN_TRACEE;
        (void)pthread_cond_wait(&changed, &mutex);
    }
}

// Blocks until there is something to be told of the child, and leaves it there. Returns what
// siginfo_t calls its code, or -1.
int look_at_child(pid_t pid) {
    siginfo_t info;
    int result;
    do {
        result = waitid(P_PID, static_cast<id_t>(pid), &info, WEXITED | WNOWAIT);
    } while (result == -1 && errno == EINTR);
    return result == -1 ? -1 : info.si_code;
}

// Reaps a child that has ended, unless a tracer has come: that one must see the end, too.
bool reap_if_free(pid_t pid, int *status) {
    Lock lock;
    ChildEntry *entry = find(pid);
    if (entry == nullptr || entry->ended || entry->tracer != 0 ||
        waitpid(pid, status, WNOHANG) != pid)
        return false;
    remove(entry);
    return true;
}

// The status of a child that is not there any more, if a tracer has brought it; else, as the end of
// the wait, forgets the child.
bool take_or_forget(pid_t pid, int *status) {
    Lock lock;
    ChildEntry *entry = find(pid);
    if (entry == nullptr)
        return false;
    const bool ended = entry->ended;
    if (ended)
        *status = entry->status;
    remove(entry);
    return ended;
}

pid_t wait_for_own_tracee(pid_t pid, int *status) {
    pid_t waited;
    do {
        waited = waitpid(pid, status, 0);
    } while (waited == -1 && errno == EINTR);
    if (waited == -1 || has_ended(*status))
        forget_child(pid);
    return waited;
}

// Whether the patience that begins with the first call, `*since` being 0, has ended.
bool is_over(int64_t *since) {
    if (*since == 0)
        *since = monotonic_ms();
    return monotonic_ms() - *since >= STATUS_PATIENCE_MS;
}

pid_t wait_for_end(pid_t pid, int *status) {
    bool stop_seen = false;
    int64_t gone_ms = 0;  // since when there is no child and no status
    for (;;) {
        switch (await_tracer(pid, status)) {
            case Wait::DONE:
                return pid;
            case Wait::OWN_TRACEE:
                return wait_for_own_tracee(pid, status);
            case Wait::GONE:
                return -1;
            case Wait::FREE:
                break;
        }
        const int code = look_at_child(pid);
        if (code == CLD_EXITED || code == CLD_KILLED || code == CLD_DUMPED) {
            if (reap_if_free(pid, status))
                return pid;
        } else if (code != -1) {
            // Nearly always the tracer has claimed the child, and is waited for in the next round.
            if (stop_seen)
                sleep_ms(STOP_POLL_MS);
            stop_seen = true;
        } else if (waiting_tracers == 0 || is_over(&gone_ms)) {
            // Asked in this order: a tracer that is not waiting any more has brought its status.
            if (take_or_forget(pid, status))
                return pid;
            errno = ECHILD;
            return -1;
        } else {
            sleep_ms(STATUS_POLL_MS);
        }
    }
}

void deliver(pid_t pid, int status) {
    Lock lock;
    ChildEntry *entry = find_running(pid);
    if (entry == nullptr)
        return;
    entry->ended = true;
    entry->status = status;
    entry->tracer = 0;
    (void)pthread_cond_broadcast(&changed);
}

}  // namespace

pid_t fork_child(bool trace_me) {
    // Under the lock, so that whoever reaps the child finds its entry. The new process begins with
    // the lock held by this thread, its only one, and gives it back as well.
    Lock lock;
    ChildEntry *entry = make_entry(0);
    if (entry == nullptr) {
        errno = ENOMEM;
        return -1;
    }
    pid_t pid = fork();
    if (pid > 0) {
        entry->pid = pid;
        entry->tracer = trace_me ? this_thread() : 0;
    } else if (pid == -1) {
        int error = errno;
        remove(entry);
        errno = error;
    }
    return pid;
}

pid_t wait_for_child(pid_t pid, int *status) {
    if (pid == -1)
        return -1;  // to the kernel that would be any child
    int own_status;
    return wait_for_end(pid, status != nullptr ? status : &own_status);
}

void signal_child(pid_t pid, int sig) {
    // A tracer may have reaped it in this instant; a number is not given out again that soon.
    Lock lock;
    const ChildEntry *entry = find(pid);
    if (pid > 0 && entry != nullptr && !entry->ended)
        (void)kill(pid, sig);
}

void forget_child(pid_t pid) {
    Lock lock;
    ChildEntry *entry = find(pid);
    if (entry == nullptr)
        return;
    remove(entry);
    (void)pthread_cond_broadcast(&changed);
}

bool claim_child(pid_t pid) {
    Lock lock;
    ChildEntry *entry = find_running(pid);
    if (entry == nullptr || entry->tracer != 0)
        return false;
    entry->tracer = this_thread();
    return true;
}

void release_child(pid_t pid) {
    Lock lock;
    ChildEntry *entry = find_running(pid);
    if (entry == nullptr || entry->tracer != this_thread())
        return;
    entry->tracer = 0;
    (void)pthread_cond_broadcast(&changed);
}

pid_t wait_as_tracer(pid_t pid, int *status, int options) {
    ++waiting_tracers;
    pid_t waited = waitpid(pid, status, options);
    int error = errno;
    if (waited > 0 && has_ended(*status))
        deliver(waited, *status);
    --waiting_tracers;
    errno = error;
    return waited;
}
