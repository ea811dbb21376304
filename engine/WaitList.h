// Wait nodes, the free list and the deadline-sorted wait list.
//
// Concurrency design
// ------------------
// Every node is always in exactly one place: free, held by a caller, queued,
// or being fired. Links (`next`, `prev`), the list heads, node `state`, the
// version counter and the arming of the earliest deadline change only under
// gSchedLock, a priority-inheriting mutex. Its critical sections are short
// list operations: a walk of at most 128 nodes, each step a comparison of
// two 64-bit numbers, plus one SetExpiry. Nothing slow happens under it: no
// clock conversion (a global-clock deadline is placed with one offset between
// the global and the monotonic clock, measured before the lock is taken, see
// GlobalOffset), no I/O (diagnostics are written after it is released), no
// semaphore post and no callback. So the timer thread never waits for a
// caller longer than one such operation, and a caller holding it is boosted
// to the timer thread's priority while the timer thread waits.
//
// Firing is split in two: under the lock the tick service unlinks the node
// and marks it kFiring; without the lock it posts the semaphore and runs the
// callback; under the lock again it settles the node (free, or kFired and
// left with its holder). A holder's ReleaseWaitNode of a node that is being
// fired waits until the firing is settled (unless it runs on the timer thread
// itself, in a callback): after ReleaseWaitNode returns, the library no longer
// touches that node's semaphore or callback. Releasing a fired-and-unlinked
// node never touches the wait list. A double release or a pointer that is not
// a pool node is refused with one diagnostic line.
#ifndef QUELTA_ENGINE_WAITLIST_H
#define QUELTA_ENGINE_WAITLIST_H

#include <pthread.h>

#include <atomic>
#include <cstdint>

#include "quelta/ClockTime.h"
#include "quelta/PalSemaphore.h"

// The record of one pending wait. Declared at global scope: the runtime holds
// nodes as opaque `WaitNode*` handles (quelta/ClockTime.h).
struct WaitNode {
    // Fields in the record's documented order.
    std::atomic<PalSemaphore*> semaphore;
    std::atomic<uint64_t> deadline;          // ClockTime value (low word first)
    std::atomic<QueltaWaitCallbackFn> callback;
    std::atomic<void*> callbackArg;
    std::atomic<uint32_t> fireCount;
    std::atomic<uint32_t> isGlobal;
    std::atomic<WaitNode*> next;
    std::atomic<WaitNode*> prev;             // kNotQueued before first taking
    std::atomic<PalSemaphore*> ownSemaphore;
    std::atomic<uint32_t> autoRelease;
    std::atomic<uint8_t> abortable;
    // Beyond the record: where the node is, and a release requested by its
    // holder while the tick service was firing it.
    std::atomic<uint32_t> state;
    std::atomic<uint32_t> releasePending;
    // The monotonic time at which the node's holder, blocked in its own timed
    // wait, wakes by itself (0: it does not). The holder writes it; the tick
    // service reads it under the lock and neither arms the timer for such a
    // node nor posts it once that time has come, as the holder's own wake
    // ends the wait then: only a wall-clock step that brings the deadline
    // well before it calls for the timer thread.
    std::atomic<uint64_t> selfWakeAt;
    std::atomic<uint8_t> postOnFire;  // set by the pass that detaches the node
};

namespace quelta {

constexpr uint32_t kWaitNodeCount = 128;

// A node whose holder wakes by itself needs the timer thread only when its
// deadline comes this much before that wake (a step of the wall clock): the
// conversion's own noise is far below it.
constexpr uint64_t kSelfWakeSlackNs = 50000;

enum class NodeState : uint32_t {
    kFree = 0,     // on the free list (or never taken)
    kHeld = 1,     // taken by a caller, not queued
    kQueued = 2,   // on the wait list
    kFiring = 3,   // unlinked by the tick service, post/callback in progress
    kFired = 4,    // fired and unlinked, held by its holder until released
};


// The mark of a node that was never queued: 0xFFFFFFFF on every target.
inline WaitNode* NotQueuedMark() {
    return reinterpret_cast<WaitNode*>(static_cast<uintptr_t>(0xFFFFFFFFu));
}

extern pthread_mutex_t gSchedLock;

// Initialises gSchedLock once (load hook, and tests that build their own pool).
void InitSchedLock();

// Scoped hold of gSchedLock.
class SchedLockGuard {
public:
    SchedLockGuard();
    ~SchedLockGuard();
    SchedLockGuard(const SchedLockGuard&) = delete;
    SchedLockGuard& operator=(const SchedLockGuard&) = delete;
};

// The offset between the global and the monotonic clock at one moment:
// global time minus monotonic time (wrapping). Every step and slew of the
// wall clock up to that moment is in it. Measured with one conversion
// (engine slot 15) outside any lock; 0 without an engine. The monotonic
// reading it converted is stored in `monotonic` when given.
int64_t GlobalOffset(uint64_t* monotonic = nullptr);
// The same from a pass's own reading pair (now and its global equivalent).
inline int64_t GlobalOffsetOf(uint64_t monotonic, uint64_t global) {
    return static_cast<int64_t>(global - monotonic);
}

// True while global-clock nodes are queued (exact under gSchedLock; a hint
// without it).
bool GlobalNodesQueued();

// The monotonic time of global time `g` at `offset`, as the scheduler reads
// it: NeverTime stays NeverTime; a time that comes before the global zero in
// the library's order (high word 0xFFFFFFFF), or that lies before the
// monotonic clock's zero, has passed and reads 0; a time beyond the
// monotonic range reads as the latest ordinary time.
uint64_t GlobalToMonotonicAt(uint64_t g, int64_t offset);

// The node's effective deadline: its deadline, or for a global-clock node the
// monotonic equivalent at `offset`.
uint64_t EffectiveDeadline(const WaitNode* node, int64_t offset);

// Builds a pool in `pool` (zeroed, linked, autoRelease 1, not-queued mark)
// without semaphores; start-up adds them. Makes it the free list.
void InitWaitNodePool(WaitNode* pool, uint32_t count);

// Pops the free list; null when it is empty or the event system is not ready.
// The node comes with its own semaphore empty.
WaitNode* TakeFreeNode();

// True when a timer serves expiries (read under gSchedLock, so that the stop
// cannot delete the timer under the question).
bool TimerServesNow();

// 0 queued (it may already have fired); 1 no timer, not queued.
uint32_t InsertWaitNode(WaitNode* node, const ClockTime* deadline,
                        QueltaWaitCallbackFn callback, void* callbackArg);
void ReleaseWaitNode(WaitNode* node);
// As ReleaseWaitNode; 1 when the node had fired (its semaphore was posted),
// 0 when it was cancelled, never queued, or the release was refused.
uint32_t ReleaseWaitNodeReport(WaitNode* node);
void FireWaitNode(WaitNode* node);  // tick service only

// Tick service helpers. With the lock held, the pass takes the nodes it is
// to fire off the wait list (marked firing): every abortable global-clock
// node, or every due node (global ones at `offset`) in list order, wherever
// it stands (a wall-clock step can leave a due global node behind one that is
// not), folding the earliest remaining deadline that needs the timer into
// gNextDeadline. Each returns how many it put into `batch` (room for `room`).
uint32_t DetachAbortableGlobalNodesLocked(WaitNode** batch, uint32_t room);
uint32_t DetachDueNodesLocked(uint64_t now, int64_t offset, WaitNode** batch, uint32_t room);
// Without the lock: posts the node's semaphore and runs its callback; returns
// the release decision, to be settled with the lock held.
uint32_t RunFiring(WaitNode* node);
void SettleFiringLocked(WaitNode* node, uint32_t release);

// The stop, once the timer thread is gone: in one hold of the lock the event
// system is marked not ready and the free list emptied (no caller can take a
// node any more), and every queued node is fired as the tick service would,
// except that no callback runs (the library is going away under it); then
// their semaphores are posted. Returns the number of nodes fired.
uint32_t CloseEventSystemForStop();

// True when `node` points at a node of the current pool.
bool IsPoolNode(const WaitNode* node);

// Audit for tests: walks both lists; true when every node is in exactly one
// place and the wait list is doubly linked. Counts are written when non-null.
bool AuditWaitNodes(uint32_t* freeCount, uint32_t* queuedCount, uint32_t* heldCount);

}  // namespace quelta

#endif
