// Wait nodes, the free list and the wait list (design notes in WaitList.h).
#include "engine/WaitList.h"

#include <sched.h>
#include <time.h>

#include "engine/ClockTimeOps.h"
#include "engine/LibraryFrame.h"
#include "engine/LibraryUse.h"
#include "engine/SchedulerState.h"
#include "engine/SystemClock.h"
#include "engine/TimerArming.h"
#include "engine/tKPusTimingEngine.h"
#include "nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.h"
#include "tLinux/PalSemaphoreOps.h"
#include "tLinux/PalThreads.h"

namespace quelta {

namespace {

std::atomic<bool> gSchedLockReady{false};

constexpr std::memory_order kRelaxed = std::memory_order_relaxed;

// Global-clock nodes on the wait list. Changed under the lock; an inserter
// reads it before taking the lock to know whether it needs an offset, and
// checks again under the lock.
std::atomic<uint32_t> gQueuedGlobalNodes{0};

// The lowest and highest offset (global minus monotonic clock) that the
// queued nodes were placed with, since global nodes have been queued (they
// mean nothing while gQueuedGlobalNodes is 0). Read and written only with the
// lock held (plain words: the lock orders them). While they lie close
// together the list is in the order of its deadlines, to within their spread;
// a step or a long slew of the wall clock since the first of those inserts
// spreads them apart.
int64_t gPlacedOffsetLow = 0;
int64_t gPlacedOffsetHigh = 0;

void CountQueued(const WaitNode* node, int32_t delta) {
    if (node->isGlobal.load(kRelaxed) != 0) {
        gQueuedGlobalNodes.store(gQueuedGlobalNodes.load(kRelaxed) + static_cast<uint32_t>(delta), kRelaxed);
    }
}

// An insert places its node with `offset` (called before it is linked). The
// first global node of an otherwise monotonic list starts a fresh span: the
// list is in order again, whatever came before. Lock held.
void NotePlacementOffset(int64_t offset) {
    const bool fresh = gQueuedGlobalNodes.load(kRelaxed) == 0;
    if (fresh || offset < gPlacedOffsetLow) gPlacedOffsetLow = offset;
    if (fresh || offset > gPlacedOffsetHigh) gPlacedOffsetHigh = offset;
}

// Unlinks a queued node from the wait list. Lock held. The node's own links
// keep their values; nothing else refers to it afterwards.
void UnlinkQueued(WaitNode* node) {
    WaitNode* next = node->next.load(kRelaxed);
    WaitNode* prev = node->prev.load(kRelaxed);
    if (gWaitList.load(kRelaxed) == node) {
        gWaitList.store(next, std::memory_order_release);
        if (next != nullptr) next->prev.store(nullptr, kRelaxed);
    } else if (prev != nullptr) {
        prev->next.store(next, std::memory_order_release);
        if (next != nullptr) next->prev.store(prev, kRelaxed);
    }
    gWaitListVersion.fetch_add(1, std::memory_order_release);
    CountQueued(node, -1);
}

// Pushes a node on the free list. Lock held.
void PushFree(WaitNode* node) {
    node->next.store(gFreeList.load(kRelaxed), kRelaxed);
    node->state.store(static_cast<uint32_t>(NodeState::kFree), kRelaxed);
    gFreeList.store(node, kRelaxed);
}

// Where an insert links its node, found by a walk made before the lock is
// taken, so that the lock is held for the link alone and the timer thread
// never waits on it for a caller's walk. The walk reads a list that may
// change under it; every change of the list's shape moves gWaitListVersion
// (with the lock held, after the change), so the place is right when the
// version still reads the same under the lock, and is found again there
// otherwise.
struct Placement {
    bool found;
    uint32_t version;
    WaitNode* after;  // the node to link behind; null: as the head
};

Placement FindPlacement(const WaitNode* node, int64_t offset) {
    Placement place{false, gWaitListVersion.load(std::memory_order_acquire), nullptr};
    const uint64_t own = EffectiveDeadline(node, offset);
    WaitNode* current = gWaitList.load(std::memory_order_acquire);
    for (uint32_t steps = 0; current != nullptr; ++steps) {
        if (steps == kWaitNodeCount) return place;  // led astray by changes: walk under the lock
        if (Earlier(own, EffectiveDeadline(current, offset))) break;
        place.after = current;
        current = current->next.load(std::memory_order_acquire);
    }
    place.found = true;
    return place;
}

// Links `node` into the wait list in deadline order, behind every node whose
// effective deadline (global ones at `offset`) is not later than its own: at
// `place` when the list has not changed since it was found, else at the
// place a walk finds now. Lock held.
void LinkSorted(WaitNode* node, int64_t offset, Placement place) {
    if (!place.found || place.version != gWaitListVersion.load(kRelaxed)) place = FindPlacement(node, offset);
    WaitNode* following = place.after != nullptr ? place.after->next.load(kRelaxed) : gWaitList.load(kRelaxed);
    node->prev.store(place.after, kRelaxed);
    node->next.store(following, kRelaxed);
    if (following != nullptr) following->prev.store(node, kRelaxed);
    if (place.after != nullptr) {
        place.after->next.store(node, std::memory_order_release);
    } else {
        gWaitList.store(node, std::memory_order_release);
    }
    gWaitListVersion.fetch_add(1, std::memory_order_release);
    CountQueued(node, +1);
    node->state.store(static_cast<uint32_t>(NodeState::kQueued), kRelaxed);
}

// True when the timer thread must wake for the node at `effective`: unless
// its holder wakes by itself at about that time anyway.
bool NeedsTimer(const WaitNode* node, uint64_t effective) {
    const uint64_t self = node->selfWakeAt.load(kRelaxed);
    return self == 0 || Earlier(effective + kSelfWakeSlackNs, self);
}

// How far apart the offsets of the placements and of now may lie before the
// list's order is taken as stale. Within it, a node behind one that is not
// due can be due by at most this much, and fires when that one does: offsets
// measured at different moments differ by well under a microsecond unless
// the measuring thread was preempted.
constexpr int64_t kOrderToleranceNs = 10 * 1000;

// Whether the list's order can differ from the deadlines' order by more than
// kOrderToleranceNs at `offset`. Each node is placed by its deadline at its
// insert, among global-clock nodes with that moment's offset; a step of the
// wall clock since moves every global deadline at once, and then no search
// can stop at the first node. Lock held.
bool OrderMayBeStale(int64_t offset) {
    if (gQueuedGlobalNodes.load(kRelaxed) == 0) return false;
    const int64_t low = offset < gPlacedOffsetLow ? offset : gPlacedOffsetLow;
    const int64_t high = offset > gPlacedOffsetHigh ? offset : gPlacedOffsetHigh;
    return high - low > kOrderToleranceNs;
}

// The earliest deadline among the queued nodes that need the timer thread
// (a holder that wakes by itself does not), when the list is in order: the
// first such node. Lock held.
bool FirstNeedingTimer(int64_t offset, uint64_t& out) {
    for (WaitNode* n = gWaitList.load(kRelaxed); n != nullptr; n = n->next.load(kRelaxed)) {
        const uint64_t effective = EffectiveDeadline(n, offset);
        if (NeedsTimer(n, effective)) {
            out = effective;
            return true;
        }
    }
    return false;
}

// On the timer thread, in a callback. Lock held (the timer cannot go away).
bool OnTimerThread() {
    tKPusLinuxNanoSleepTimer* timer = gTimer.load(std::memory_order_acquire);
    return timer != nullptr && timer->OnTimerThread();
}

// Waits a moment for the tick service to finish firing a node.
void PauseForFiring(uint32_t round) {
    if (round < 64) {
        sched_yield();
    } else {
        timespec ts{0, 20000};  // 20 us
        nanosleep(&ts, nullptr);
    }
}

}  // namespace

pthread_mutex_t gSchedLock;

void InitSchedLock() {
    if (gSchedLockReady.load(std::memory_order_acquire)) return;
    pthread_mutexattr_t attr;
    pthread_mutexattr_init(&attr);
    // Priority inheritance: a caller holding the lock while the timer thread
    // waits for it runs at the timer thread's priority until it lets go.
    pthread_mutexattr_setprotocol(&attr, PTHREAD_PRIO_INHERIT);
    pthread_mutex_init(&gSchedLock, &attr);
    pthread_mutexattr_destroy(&attr);
    gSchedLockReady.store(true, std::memory_order_release);
}

namespace {

inline void CpuRelax() {
#if defined(__x86_64__) || defined(__i386__)
    __builtin_ia32_pause();
#elif defined(__arm__) || defined(__aarch64__)
    asm volatile("yield" ::: "memory");
#endif
}

// Holds are a few hundred nanoseconds, so a thread that finds the lock taken
// by a thread that is running does better to spin a moment than to sleep in
// the kernel and be woken again (a wake-up costs tens of microseconds on a
// busy machine, which the timer thread would add to every expiry it serves).
// The spin is bounded: a holder that is not running (preempted) is then
// boosted by priority inheritance as the spinner blocks.
constexpr int kLockSpins = 32;

}  // namespace

// The timer is armed under the lock, but woken only once it is released
// (see BeginDeferringTimerWakes): the timer thread, woken, may need the lock
// at once.
SchedLockGuard::SchedLockGuard() {
    BeginDeferringTimerWakes();
    for (int i = 0; i < kLockSpins; ++i) {
        if (pthread_mutex_trylock(&gSchedLock) == 0) return;
        CpuRelax();
    }
    pthread_mutex_lock(&gSchedLock);
}
SchedLockGuard::~SchedLockGuard() {
    pthread_mutex_unlock(&gSchedLock);
    EndDeferringTimerWakes();
}

int64_t GlobalOffset(uint64_t* monotonicOut) {
    timespec ts{};
    gSystemClock.getTime(CLOCK_MONOTONIC, &ts);  // not recorded: this is no reading of the caller's
    const uint64_t monotonic = static_cast<uint64_t>(ts.tv_sec) * 1000000000u + static_cast<uint64_t>(ts.tv_nsec);
    if (monotonicOut != nullptr) *monotonicOut = monotonic;
    tKPusTimingEngine* engine = gEngine.load(std::memory_order_acquire);
    if (engine == nullptr) return 0;
    iKPusTimingEngine* e = engine;
    return GlobalOffsetOf(monotonic, ToU64(e->MonotonicToGlobal(FromU64(monotonic))));
}

bool GlobalNodesQueued() { return gQueuedGlobalNodes.load(kRelaxed) != 0; }

uint64_t GlobalToMonotonicAt(uint64_t g, int64_t offset) {
    if (IsNever(g)) return kNeverTime64;
    if (static_cast<uint32_t>(g >> 32) == 0xFFFFFFFFu) return 0;  // before the global zero
    if (offset >= 0) {
        const uint64_t o = static_cast<uint64_t>(offset);
        return g < o ? 0 : g - o;  // before the monotonic zero: passed
    }
    const uint64_t o = static_cast<uint64_t>(-(offset + 1)) + 1;
    constexpr uint64_t kLatest = kNeverTime64 - 1;
    return g > kLatest - o ? kLatest : g + o;
}

uint64_t EffectiveDeadline(const WaitNode* node, int64_t offset) {
    const uint64_t deadline = node->deadline.load(kRelaxed);
    if (node->isGlobal.load(kRelaxed) == 0) return deadline;
    return GlobalToMonotonicAt(deadline, offset);
}

void InitWaitNodePool(WaitNode* pool, uint32_t count) {
    InitSchedLock();
    for (uint32_t i = 0; i < count; ++i) {
        WaitNode& n = pool[i];
        n.semaphore.store(nullptr, kRelaxed);
        n.deadline.store(0, kRelaxed);
        n.callback.store(nullptr, kRelaxed);
        n.callbackArg.store(nullptr, kRelaxed);
        n.fireCount.store(0, kRelaxed);
        n.isGlobal.store(0, kRelaxed);
        n.next.store(i + 1 < count ? &pool[i + 1] : nullptr, kRelaxed);
        n.prev.store(NotQueuedMark(), kRelaxed);
        n.ownSemaphore.store(nullptr, kRelaxed);  // start-up creates them next
        n.autoRelease.store(1, kRelaxed);
        n.abortable.store(0, kRelaxed);
        n.state.store(static_cast<uint32_t>(NodeState::kFree), kRelaxed);
        n.releasePending.store(0, kRelaxed);
        n.selfWakeAt.store(0, kRelaxed);
        n.postOnFire.store(1, kRelaxed);
    }
    SchedLockGuard lock;
    gWaitNodePool.store(pool, kRelaxed);
    gWaitList.store(nullptr, kRelaxed);
    gFreeList.store(count ? pool : nullptr, kRelaxed);
    gQueuedGlobalNodes.store(0, kRelaxed);
}

bool IsPoolNode(const WaitNode* node) {
    const WaitNode* pool = gWaitNodePool.load(kRelaxed);
    if (pool == nullptr || node == nullptr) return false;
    uintptr_t p = reinterpret_cast<uintptr_t>(node);
    uintptr_t base = reinterpret_cast<uintptr_t>(pool);
    if (p < base || p >= base + kWaitNodeCount * sizeof(WaitNode)) return false;
    return (p - base) % sizeof(WaitNode) == 0;
}

WaitNode* TakeFreeNode() {
    if (gEventSystemReady.load(kRelaxed) == 0) return nullptr;
    WaitNode* node;
    {
        SchedLockGuard lock;
        // Checked again under the lock: the stop closes the event system in
        // one hold of it, so nobody takes a node from a pool about to go.
        if (gEventSystemReady.load(kRelaxed) == 0) return nullptr;
        node = gFreeList.load(kRelaxed);
        if (node == nullptr) return nullptr;
        gFreeList.store(node->next.load(kRelaxed), kRelaxed);
        node->state.store(static_cast<uint32_t>(NodeState::kHeld), kRelaxed);
        node->releasePending.store(0, kRelaxed);
    }
    // A global wait that ended on its own may have left the node's firing
    // post behind on its own semaphore: every use starts with it empty.
    PalSemaphore* own = node->ownSemaphore.load(kRelaxed);
    if (own != nullptr) PalSemaphoreWait(own, 0);
    return node;
}

bool TimerServesNow() {
    SchedLockGuard lock;
    return TimerServing();
}

uint32_t InsertWaitNode(WaitNode* node, const ClockTime* deadline,
                        QueltaWaitCallbackFn callback, void* callbackArg) {
    node->callbackArg.store(callbackArg, kRelaxed);
    node->callback.store(callback, kRelaxed);
    node->deadline.store(ToU64(*deadline), kRelaxed);

    // The offset is measured before the lock is taken, and only when a
    // global-clock node is placed or may be passed.
    bool needOffset = node->isGlobal.load(kRelaxed) != 0 || gQueuedGlobalNodes.load(kRelaxed) != 0;
    for (;;) {
        const int64_t offset = needOffset ? GlobalOffset() : 0;
        const Placement place = FindPlacement(node, offset);
        SchedLockGuard lock;
        if (!needOffset && gQueuedGlobalNodes.load(kRelaxed) != 0) {
            needOffset = true;  // a global node arrived meanwhile: measure, then place
            continue;
        }
        bool queued = false;
        // Without a serving timer nothing would ever fire the node: refuse it
        // whatever its deadline instead of letting its waiter hang.
        if (TimerServing()) {
            if (needOffset) NotePlacementOffset(offset);
            LinkSorted(node, offset, place);
            queued = true;
            // Armed for whenever it is earlier than the armed time, head or
            // not: a head whose holder wakes by itself left the timer for
            // the tick, and after a wall-clock step the head need not be
            // the earliest.
            const uint64_t effective = EffectiveDeadline(node, offset);
            if (NeedsTimer(node, effective) && Earlier(effective, gNextDeadline.Load())) {
                gNextDeadline.Store(effective);
                if (ArmTimer(FromU64(effective)) == 0) {
                    queued = false;
                    UnlinkQueued(node);
                    node->state.store(static_cast<uint32_t>(NodeState::kHeld), kRelaxed);
                }
            }
        }
        if (!queued && node->autoRelease.load(kRelaxed) != 0) PushFree(node);
        return queued ? 0 : 1;
    }
}

void ReleaseWaitNode(WaitNode* node) { (void)ReleaseWaitNodeReport(node); }

uint32_t ReleaseWaitNodeReport(WaitNode* node) {
    CallerInside inside;  // the stop frees the pool only once nobody is in here
    if (!inside || gEventSystemReady.load(kRelaxed) == 0 || node == nullptr) return 0;
    if (!IsPoolNode(node)) {
        PAL_DEBUG_PRINT("ReleaseWaitNode: %p is not a wait node of this library; ignored",
                        static_cast<void*>(node));
        return 0;
    }
    if (node->prev.load(kRelaxed) == NotQueuedMark()) return 0;  // never taken
    for (uint32_t round = 0;; ++round) {
        bool releasedTwice = false;
        {
            SchedLockGuard lock;
            const NodeState state = static_cast<NodeState>(node->state.load(kRelaxed));
            switch (state) {
                case NodeState::kFree:
                    releasedTwice = true;
                    break;
                case NodeState::kQueued:  // cancels the wait
                    UnlinkQueued(node);
                    PushFree(node);
                    return 0;
                case NodeState::kHeld:
                case NodeState::kFired:  // a fired node is off the list already
                    PushFree(node);
                    return state == NodeState::kFired ? 1 : 0;
                case NodeState::kFiring:
                    // From a callback on the timer thread the firing cannot
                    // finish while we wait: let it free the node when it settles.
                    if (OnTimerThread()) {
                        node->releasePending.store(1, kRelaxed);
                        return 1;
                    }
                    break;
            }
        }
        // Written without the lock: standard error may block (a full pipe),
        // and the timer thread must never wait for that.
        if (releasedTwice) {
            PAL_DEBUG_PRINT("ReleaseWaitNode: node %p released twice; ignored", static_cast<void*>(node));
            return 0;
        }
        PauseForFiring(round);
    }
}

// Under the lock: the node leaves the wait list and is marked as firing.
static void DetachForFiring(WaitNode* node) {
    node->fireCount.fetch_add(1, std::memory_order_release);
    UnlinkQueued(node);
    node->releasePending.store(0, kRelaxed);
    node->postOnFire.store(1, kRelaxed);
    node->state.store(static_cast<uint32_t>(NodeState::kFiring), kRelaxed);
}

void SettleFiringLocked(WaitNode* node, uint32_t release) {
    if (release != 0 || node->releasePending.load(kRelaxed) != 0) {
        PushFree(node);
    } else {
        node->state.store(static_cast<uint32_t>(NodeState::kFired), kRelaxed);
    }
}

uint32_t RunFiring(WaitNode* node) {
    PalSemaphore* semaphore = node->semaphore.load(kRelaxed);
    if (semaphore != nullptr && node->postOnFire.load(kRelaxed) != 0) PalSemaphorePost(semaphore);
    uint32_t release = node->autoRelease.load(kRelaxed);
    QueltaWaitCallbackFn callback = node->callback.load(kRelaxed);
    if (callback != nullptr) {
        release = callback(node->callbackArg.load(kRelaxed));
        node->autoRelease.store(release, kRelaxed);
    }
    return release;
}

void FireWaitNode(WaitNode* node) {
    {
        SchedLockGuard lock;
        if (node->state.load(kRelaxed) != static_cast<uint32_t>(NodeState::kQueued)) return;
        DetachForFiring(node);
    }
    const uint32_t release = RunFiring(node);
    SchedLockGuard lock;
    SettleFiringLocked(node, release);
}

uint32_t DetachDueNodesLocked(uint64_t now, int64_t offset, WaitNode** batch, uint32_t room) {
    const bool whole = OrderMayBeStale(offset);
    uint32_t n = 0;
    // With the whole list walked, the earliest of what stays queued is
    // found on the way: one walk under the lock, not two.
    bool seen = false;
    uint64_t earliest = 0;
    WaitNode* node = gWaitList.load(kRelaxed);
    while (node != nullptr && n < room) {
        WaitNode* next = node->next.load(kRelaxed);
        const uint64_t effective = EffectiveDeadline(node, offset);
        if (!Due(effective, now)) {
            if (!whole) break;  // in order: nothing behind it is due either
            if (NeedsTimer(node, effective) && (!seen || Earlier(effective, earliest))) {
                earliest = effective;
                seen = true;
            }
            node = next;
            continue;
        }
        DetachForFiring(node);
        // A holder whose own wake has come needs no post: it is waking.
        const uint64_t self = node->selfWakeAt.load(kRelaxed);
        if (self != 0 && Due(self, now)) node->postOnFire.store(0, kRelaxed);
        batch[n++] = node;
        node = next;
    }
    // What stays queued: its earliest deadline that needs the timer thread
    // goes into the next arming. (A full batch leaves due nodes behind: the
    // next pass comes at once.)
    if (node != nullptr && n == room) {
        seen = true;
        earliest = now;
    } else if (!whole) {
        seen = FirstNeedingTimer(offset, earliest);
    }
    if (seen && Earlier(earliest, gNextDeadline.Load())) gNextDeadline.Store(earliest);
    return n;
}

uint32_t DetachAbortableGlobalNodesLocked(WaitNode** batch, uint32_t room) {
    uint32_t n = 0;
    WaitNode* node = gWaitList.load(kRelaxed);
    while (node != nullptr && n < room) {
        WaitNode* next = node->next.load(kRelaxed);
        if (node->isGlobal.load(kRelaxed) != 0 && node->abortable.load(kRelaxed) != 0) {
            DetachForFiring(node);
            batch[n++] = node;
        }
        node = next;
    }
    return n;
}

uint32_t CloseEventSystemForStop() {
    WaitNode* fired[kWaitNodeCount];
    uint32_t n = 0;
    {
        SchedLockGuard lock;
        gEventSystemReady.store(0, std::memory_order_release);
        gFreeList.store(nullptr, kRelaxed);
        while (WaitNode* node = gWaitList.load(kRelaxed)) {
            if (n == kWaitNodeCount) break;
            DetachForFiring(node);
            fired[n++] = node;
        }
    }
    for (uint32_t i = 0; i < n; ++i) {
        if (PalSemaphore* semaphore = fired[i]->semaphore.load(kRelaxed)) PalSemaphorePost(semaphore);
    }
    SchedLockGuard lock;
    for (uint32_t i = 0; i < n; ++i) SettleFiringLocked(fired[i], fired[i]->autoRelease.load(kRelaxed));
    return n;
}

bool AuditWaitNodes(uint32_t* freeCount, uint32_t* queuedCount, uint32_t* heldCount) {
    SchedLockGuard lock;
    WaitNode* pool = gWaitNodePool.load(kRelaxed);
    if (pool == nullptr) return false;
    uint8_t seen[kWaitNodeCount] = {};
    bool ok = true;
    uint32_t nFree = 0, nQueued = 0, nHeld = 0;
    for (WaitNode* n = gFreeList.load(kRelaxed); n != nullptr; n = n->next.load(kRelaxed)) {
        if (!IsPoolNode(n) || seen[n - pool]++ || nFree > kWaitNodeCount) return false;
        ok = ok && n->state.load(kRelaxed) == static_cast<uint32_t>(NodeState::kFree);
        ++nFree;
    }
    WaitNode* prev = nullptr;
    for (WaitNode* n = gWaitList.load(kRelaxed); n != nullptr; n = n->next.load(kRelaxed)) {
        if (!IsPoolNode(n) || seen[n - pool]++ || nQueued > kWaitNodeCount) return false;
        ok = ok && n->state.load(kRelaxed) == static_cast<uint32_t>(NodeState::kQueued);
        ok = ok && n->prev.load(kRelaxed) == prev;
        prev = n;
        ++nQueued;
    }
    for (uint32_t i = 0; i < kWaitNodeCount; ++i) {
        if (seen[i]) continue;
        uint32_t s = pool[i].state.load(kRelaxed);
        // Not on a list: must be held by a caller (taken, or fired and unlinked).
        ok = ok && (s == static_cast<uint32_t>(NodeState::kHeld) ||
                    s == static_cast<uint32_t>(NodeState::kFired) ||
                    s == static_cast<uint32_t>(NodeState::kFiring));
        ++nHeld;
    }
    if (freeCount) *freeCount = nFree;
    if (queuedCount) *queuedCount = nQueued;
    if (heldCount) *heldCount = nHeld;
    return ok;
}

}  // namespace quelta
