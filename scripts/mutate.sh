#!/usr/bin/env bash
# Mutation testing, on demand (not in CI). Each mutant below is one small
# deliberate fault in the library: an exact piece of source text and what it
# becomes. Each is applied alone to a copy of the tree (the working tree is
# never edited), built, and the unit label run, then rt, integration and
# kext. An `i686.` mutant is a fault only a 32-bit target has: it is built for
# i686 and run against kext there. A mutant is killed when a test fails or
# hangs; tests that fail without any mutant are left out. A mutant that does
# not compile is reported and not counted.
#
# Usage: scripts/mutate.sh [--check] [--list] [--only ID,...] [--jobs N]
#                          [--work DIR] [--tests REGEX] [--all-killers]
#   --check        verify that every mutant's text occurs exactly once
#   --list         print the mutants
#   --only         run the named mutants (and the baseline)
#   --work         the scratch directory (default build/mutation)
#   --tests        run only the tests whose names match REGEX
#   --all-killers  run every test against every mutant and name all that fail
#
# List format: `id @@ file @@ original text @@ mutated text`; `<NL>` stands
# for a line break.
set -uo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
work=$root/build/mutation

check_only=0 list_only=0 only="" jobs=2 tests="" all_killers=0
while [ $# -gt 0 ]; do
  case $1 in
    --check) check_only=1 ;;
    --list) list_only=1 ;;
    --only) only=$2; shift ;;
    --jobs) jobs=$2; shift ;;
    --work) work=$(realpath -m "$2"); shift ;;
    --tests) tests=$2; shift ;;
    --all-killers) all_killers=1 ;;
    *) echo "usage: $0 [--check] [--list] [--only ID[,ID...]] [--jobs N] [--work DIR] [--tests REGEX] [--all-killers]" >&2; exit 2 ;;
  esac
  shift
done

mutants() {
  cat <<'EOF'
# --- time order and NeverTime (engine/ClockTimeOps.h) ---
order.never-either-word @@ engine/ClockTimeOps.h @@ return t.low == QUELTA_NEVER_LOW && t.high == QUELTA_NEVER_HIGH; @@ return t.low == QUELTA_NEVER_LOW || t.high == QUELTA_NEVER_HIGH;
order.never64-high-word @@ engine/ClockTimeOps.h @@ inline constexpr bool IsNever(uint64_t t) { return t == kNeverTime64; } @@ inline constexpr bool IsNever(uint64_t t) { return (t >> 32) == 0xFFFFFFFEu; }
order.due-strict @@ engine/ClockTimeOps.h @@ inline constexpr bool Due(uint64_t t, uint64_t now) { return !Earlier(now, t); } @@ inline constexpr bool Due(uint64_t t, uint64_t now) { return Earlier(t, now); }
order.plain-unsigned @@ engine/ClockTimeOps.h @@ inline constexpr uint64_t OrderKey(uint64_t t) { return t + (uint64_t(1) << 32); } @@ inline constexpr uint64_t OrderKey(uint64_t t) { return t; }
order.fold-later @@ engine/ClockTimeOps.h @@ if (Earlier(t, d)) d = t; @@ if (Earlier(d, t)) d = t;
# --- arming the timer (engine/TimerArming.cpp) ---
arm.high-word-far @@ engine/TimerArming.cpp @@ } else if (when.high == 0xFFFFFFFFu) { @@ } else if (false) {
arm.ended-thread-serves @@ engine/TimerArming.cpp @@ if (timer == nullptr || !timer->IsServing()) return 0; @@ if (timer == nullptr) return 0;
# --- the tick service (engine/TickService.cpp) ---
tick.jitter-bound @@ engine/HandOff.h @@ if (n < 0 || n >= static_cast<int32_t>(size)) return false; @@ if (n < 0 || n > static_cast<int32_t>(size)) return false;
tick.jitter-negative @@ engine/HandOff.h @@ if (n < 0 || n >= static_cast<int32_t>(size)) return false; @@ if (n >= static_cast<int32_t>(size)) return false;
tick.jitter-sample @@ engine/TickService.cpp @@ static_cast<uint32_t>(now - nextTick) @@ static_cast<uint32_t>(now - nextTick + 1)
tick.replay-missed @@ engine/TickService.cpp @@ if (Earlier(nextTick, now)) nextTick = now; @@ (void)0;
tick.period-twice @@ engine/TickService.cpp @@ nextTick += gTickPeriod.Load(); @@ nextTick += 2 * gTickPeriod.Load();
tick.deadline-not-tick @@ engine/TickService.cpp @@     gNextDeadline.Store(gNextTick.Load());<NL>    return tickDue; @@     return tickDue;
tick.monotonic-due-strict @@ engine/TickService.cpp @@ Due(callbackTime, now), &nowTime); @@ Earlier(callbackTime, now), &nowTime);
tick.monotonic-kept @@ engine/TickService.cpp @@ if (!due || !cell.CompareExchange(time, kNeverTime64)) return false; @@ if (!due) return false;
tick.global-never-converted @@ engine/TickService.cpp @@ if (!globalDue && !IsNever(globalTime)) globalAsMonotonic @@ if (!globalDue) globalAsMonotonic
tick.global-due-strict @@ engine/TickService.cpp @@ const bool globalDue = Due(globalTime, nowGlobal); @@ const bool globalDue = Earlier(globalTime, nowGlobal);
tick.global-not-folded @@ engine/TickService.cpp @@                 FoldIntoNextDeadline(globalAsMonotonic); @@                 (void)globalAsMonotonic;
tick.monotonic-not-folded @@ engine/TickService.cpp @@                 FoldIntoNextDeadline(monotonicTime); @@                 (void)monotonicTime;
tick.generation-ignored @@ engine/TickService.cpp @@ work.fired = DetachAbortableGlobalNodesLocked(work.batch, kWaitNodeCount); @@ work.fired = 0;
tick.generation-forgotten @@ engine/TickService.cpp @@                 sLastGeneration.store(generation, kRelaxed);<NL> @@ <NL>
tick.global-callback-lost @@ engine/TickService.cpp @@ const bool globalFired = FireIfDue(gGlobalCallbackTime, globalTime, globalDue, &nowTime); @@ const bool globalFired = false;
tick.callback-waits-for-lock @@ engine/TickService.cpp @@ if (!due || !cell.CompareExchange(time, kNeverTime64)) return false;<NL>    CallCallback(nowTime); @@ if (!due || !cell.CompareExchange(time, kNeverTime64)) return false;<NL>    { SchedLockGuard waited; }<NL>    CallCallback(nowTime);
tick.serial-stuck @@ engine/TickService.cpp @@ sTickSerial.fetch_add(1, kRelaxed); @@ (void)0;
tick.argument-ignored @@ engine/TickService.cpp @@ fn(arg != nullptr ? arg : const_cast<ClockTime*>(now)); @@ fn(const_cast<ClockTime*>(now));
# --- wait list (engine/WaitList.cpp) ---
list.head-due-strict @@ engine/WaitList.cpp @@ if (!Due(effective, now)) {<NL>            if (!whole) break; @@ if (!Earlier(effective, now)) {<NL>            if (!whole) break;
list.equal-before @@ engine/WaitList.cpp @@ if (Earlier(own, EffectiveDeadline(current, offset))) break; @@ if (!Earlier(EffectiveDeadline(current, offset), own)) break;
list.new-head-not-armed @@ engine/WaitList.cpp @@ if (NeedsTimer(node, effective) && Earlier(effective, gNextDeadline.Load())) { @@ if (false) {
list.queued-without-timer @@ engine/WaitList.cpp @@         if (TimerServing()) {<NL>            if (needOffset) NotePlacementOffset(offset); @@         if (true) {<NL>            if (needOffset) NotePlacementOffset(offset);
list.self-waking-posted @@ engine/WaitList.cpp @@ if (self != 0 && Due(self, now)) node->postOnFire.store(0, kRelaxed); @@ (void)self;
list.self-waking-armed @@ engine/WaitList.cpp @@ return self == 0 || Earlier(effective + kSelfWakeSlackNs, self); @@ return true;
list.rest-not-folded @@ engine/WaitList.cpp @@ if (seen && Earlier(earliest, gNextDeadline.Load())) gNextDeadline.Store(earliest); @@ (void)seen;
list.walk-earliest-first @@ engine/WaitList.cpp @@ if (NeedsTimer(node, effective) && (!seen || Earlier(effective, earliest))) { @@ if (NeedsTimer(node, effective) && !seen) {
list.stale-order-ignored @@ engine/WaitList.cpp @@ return high - low > kOrderToleranceNs; @@ return false;
list.placement-not-noted @@ engine/WaitList.cpp @@ if (needOffset) NotePlacementOffset(offset); @@ (void)needOffset;
list.pass-offset-ignored @@ engine/WaitList.cpp @@ const int64_t low = offset < gPlacedOffsetLow ? offset : gPlacedOffsetLow; @@ const int64_t low = gPlacedOffsetLow;
list.armed-only-as-head @@ engine/WaitList.cpp @@ if (NeedsTimer(node, effective) && Earlier(effective, gNextDeadline.Load())) { @@ if (gWaitList.load(kRelaxed) == node && NeedsTimer(node, effective) && Earlier(effective, gNextDeadline.Load())) {
list.abort-monotonic-too @@ engine/WaitList.cpp @@ if (node->isGlobal.load(kRelaxed) != 0 && node->abortable.load(kRelaxed) != 0) { @@ if (node->abortable.load(kRelaxed) != 0) {
list.abort-unabortable-too @@ engine/WaitList.cpp @@ if (node->isGlobal.load(kRelaxed) != 0 && node->abortable.load(kRelaxed) != 0) { @@ if (node->isGlobal.load(kRelaxed) != 0) {
list.fire-not-counted @@ engine/WaitList.cpp @@ node->fireCount.fetch_add(1, std::memory_order_release); @@ (void)0;
list.foreign-accepted @@ engine/WaitList.cpp @@ if (!IsPoolNode(node)) { @@ if (false) {
list.cancel-not-unlinked @@ engine/WaitList.cpp @@                 case NodeState::kQueued:  // cancels the wait<NL>                    UnlinkQueued(node);<NL> @@                 case NodeState::kQueued:  // cancels the wait<NL>
list.release-decision-ignored @@ engine/WaitList.cpp @@ if (release != 0 || node->releasePending.load(kRelaxed) != 0) { @@ if (node->releasePending.load(kRelaxed) != 0) {
list.global-before-zero-future @@ engine/WaitList.cpp @@ if (static_cast<uint32_t>(g >> 32) == 0xFFFFFFFFu) return 0; @@ (void)0;
list.global-before-boot-future @@ engine/WaitList.cpp @@ return g < o ? 0 : g - o; @@ return g - o;
list.global-latest-wraps @@ engine/WaitList.cpp @@ return g > kLatest - o ? kLatest : g + o; @@ return g + o;
# --- callbacks (engine/Callbacks.cpp) ---
callback.not-armed @@ engine/Callbacks.cpp @@ if (Earlier(monotonic, gNextDeadline.Load())) { @@ if (false) {
callback.stored-without-timer @@ engine/Callbacks.cpp @@ if (ArmTimer(FromU64(monotonic)) == 0) return 0; @@ ArmTimer(FromU64(monotonic));
callback.never-converted @@ engine/Callbacks.cpp @@ const uint64_t monotonic = IsNever(t) ? t : ToU64(slots->GlobalToMonotonic(*when)); @@ const uint64_t monotonic = ToU64(slots->GlobalToMonotonic(*when));
callback.global-as-monotonic @@ engine/Callbacks.cpp @@ if (selector >= 0) return StoreCallbackTime(gMonotonicCallbackTime, t, t); @@ if (selector >= -1) return StoreCallbackTime(gMonotonicCallbackTime, t, t);
callback.unregister-keeps @@ engine/Callbacks.cpp @@ gTickCallback.exchange(nullptr, std::memory_order_acq_rel); @@ gTickCallback.load(std::memory_order_acquire);
# --- event and global-clock waits (engine/EventWaits.cpp) ---
event.bound-0xFFFFFFFE-past @@ engine/EventWaits.cpp @@ if (static_cast<uint32_t>(monotonic >> 32) == 0xFFFFFFFFu) return true; @@ if (static_cast<uint32_t>(monotonic >> 32) >= 0xFFFFFFFEu) return true;
event.bound-0xFFFFFFFF-far @@ engine/EventWaits.cpp @@ if (static_cast<uint32_t>(monotonic >> 32) == 0xFFFFFFFFu) return true; @@ (void)0;
event.not-started-flag-1 @@ engine/EventWaits.cpp @@     if (gEventSystemReady.load(std::memory_order_acquire) == 0) {<NL>        if (abortFlag != nullptr) *abortFlag = kAbortNotStarted; @@     if (gEventSystemReady.load(std::memory_order_acquire) == 0) {<NL>        if (abortFlag != nullptr) *abortFlag = 1;
event.stale-generation-waits @@ engine/EventWaits.cpp @@             *abortFlag = 1;<NL>            return; @@             *abortFlag = 1;
event.abort-not-flagged @@ engine/EventWaits.cpp @@ if (abortFlag != nullptr && (end == WaitEnd::kStopped || generation != gGeneration.load(kRelaxed))) { @@ if (abortFlag != nullptr && end == WaitEnd::kStopped) {
event.abort-not-ending @@ engine/EventWaits.cpp @@             return WaitEnd::kAborted; @@             (void)0;
event.abortable-without-flag @@ engine/EventWaits.cpp @@ PrepareNode(node, 1, abortFlag != nullptr ? 1 : 0, 0, node->ownSemaphore.load(kRelaxed)); @@ PrepareNode(node, 1, 1, 0, node->ownSemaphore.load(kRelaxed));
event.zero-target-either-word @@ engine/EventWaits.cpp @@ if (target != nullptr && (target->low != 0 || target->high != 0)) node = TakeFreeNode(); @@ if (target != nullptr && (target->low != 0 && target->high != 0)) node = TakeFreeNode();
event.global-sleep-not-rounded @@ engine/EventWaits.cpp @@ ClockTime d = FromU64(ToU64(*target) - ToU64(now) + 500000u); @@ ClockTime d = FromU64(ToU64(*target) - ToU64(now));
event.global-sleep-no-extra-ms @@ engine/EventWaits.cpp @@         ms += 1;<NL> @@ <NL>
event.global-sleep-two-extra-ms @@ engine/EventWaits.cpp @@         ms += 1;<NL> @@         ms += 2;<NL>
event.global-sleep-past-target @@ engine/EventWaits.cpp @@     if (Earlier(now, *target)) {<NL>        ClockTime d @@     if (true) {<NL>        ClockTime d
event.plain-timeout-no-extra-ms @@ engine/EventWaits.cpp @@ static_cast<int32_t>(timeout / 1000u + 1u) @@ static_cast<int32_t>(timeout / 1000u)
event.plain-timeout-rounded-up @@ engine/EventWaits.cpp @@ static_cast<int32_t>(timeout / 1000u + 1u) @@ static_cast<int32_t>((timeout + 999u) / 1000u + 1u)
event.callback-without-service @@ engine/EventWaits.cpp @@ if (engine == nullptr || engine->UsesTickService() == 0 ||<NL> @@ if (engine == nullptr ||<NL>
event.own-semaphore-no-wait @@ engine/EventWaits.cpp @@ if (r == 0) end = WaitUntilMonotonic(node, ToU64(copy)); @@ (void)0;
event.timeout-half @@ engine/EventWaits.cpp @@ const uint64_t deadline = ToU64(now) + clocks; @@ const uint64_t deadline = ToU64(now) + clocks / 2;
event.stray-post-ends-wait @@ engine/EventWaits.cpp @@             case BlockResult::kTaken: break;  // a stray post: the deadline stands @@             case BlockResult::kTaken: return WaitEnd::kDue;
event.global-early @@ engine/EventWaits.cpp @@ if (Due(bound, now)) return WaitEnd::kDue; @@ if (Due(bound, now) || node->fireCount.load() != 0) return WaitEnd::kDue;
# --- plain waits (engine/ClockWaits.cpp, engine/MicrosecondWaits.cpp) ---
plain.next-multiple-32-at-once @@ engine/ClockWaits.cpp @@ multiple = ClockTime{now.low / period, 0};  // one 32-bit division @@ multiple = ClockTime{(now.low - 1) / period, 0};
plain.next-multiple-32-one-more @@ engine/ClockWaits.cpp @@ multiple = ClockTime{now.low / period, 0};  // one 32-bit division @@ multiple = ClockTime{now.low / period + 1, 0};
plain.next-multiple-64-at-once @@ engine/ClockWaits.cpp @@         ClockTime remainder{period, 0};<NL>        U64DivMod(multiple, remainder); @@         ClockTime remainder{period, 0};<NL>        U64DivMod(multiple, remainder);<NL>        if (remainder.low == 0 && remainder.high == 0) return now;
plain.slot49-32-one-more @@ engine/ClockWaits.cpp @@ multiple = ClockTime{now.low / period.low, 0}; @@ multiple = ClockTime{now.low / period.low + 1, 0};
plain.slot49-at-once @@ engine/ClockWaits.cpp @@     Increment(multiple);<NL><NL>    // (m * period) @@     if (now.low % period.low == 0) multiple = ClockTime{multiple.low - 1, multiple.high};<NL>    Increment(multiple);<NL><NL>    // (m * period)
plain.slot49-high-word-lost @@ engine/ClockWaits.cpp @@ deadline.high += period.high * multiple.low; @@ (void)0;
plain.until64-not-compared @@ engine/ClockWaits.cpp @@ if (target != nullptr && quelta::Earlier(now, *target)) quelta::SleepUntilClocks(*target); @@ if (target != nullptr) quelta::SleepUntilClocks(*target);
plain.until32-tolerance-inclusive @@ engine/ClockWaits.cpp @@ if (now.low - target < tolerance) return now.low; @@ if (now.low - target <= tolerance) return now.low;
plain.until32-next-span-lost @@ engine/ClockWaits.cpp @@ deadline = ClockTime{target, now.high + 1}; @@ deadline = ClockTime{target, now.high};
plain.absolute-eintr-ends @@ engine/ClockWaits.cpp @@ while (gSystemClock.sleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &request, nullptr) == EINTR) { @@ if (gSystemClock.sleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &request, nullptr) == EINTR) {
plain.relative-restarts-whole @@ engine/ClockWaits.cpp @@         request = remaining;<NL> @@ <NL>
plain.us-zero-target-waits @@ engine/MicrosecondWaits.cpp @@ if (target == 0) return quelta::NowMicroseconds().low; @@ (void)0;
plain.us-tolerance-inclusive @@ engine/MicrosecondWaits.cpp @@ if (now.low - target < quelta::kPastToleranceUs) return now.low; @@ if (now.low - target <= quelta::kPastToleranceUs) return now.low;
plain.us-duration-32-bit @@ engine/MicrosecondWaits.cpp @@ quelta::FromU64(static_cast<uint64_t>(duration) * 1000u) @@ quelta::FromU64(static_cast<uint32_t>(duration * 1000u))
plain.us-next-multiple-at-once @@ engine/MicrosecondWaits.cpp @@ const ClockTime multiple = quelta::NextMultiple(quelta::NowMicroseconds(), period); @@ const ClockTime now = quelta::NowMicroseconds();<NL>    const ClockTime multiple = now.low % period == 0 ? now : quelta::NextMultiple(now, period);
# --- engine slots ---
engine.service-mode-1 @@ engine/tKPusTimingEngine.cpp @@ return serviceMode.load(std::memory_order_relaxed) == 0 ? 1u : 0u; @@ return serviceMode.load(std::memory_order_relaxed) < 2 ? 1u : 0u;
engine.convert-arguments-swapped @@ engine/EngineConversion.cpp @@ gSystemClock.convertTime(nr, fromClock, toClock, &k); @@ gSystemClock.convertTime(nr, toClock, fromClock, &k);
engine.kernel-arguments-swapped @@ engine/SystemClock.cpp @@ return syscall(number, static_cast<long>(fromClock), static_cast<long>(toClock), time); @@ return syscall(number, static_cast<long>(toClock), static_cast<long>(fromClock), time);
engine.raw-cost-not-rounded @@ engine/EngineStatistics.cpp @@ const uint32_t rawCost = SaturateToU32(rawSum / 1000.0 + 0.5); @@ const uint32_t rawCost = SaturateToU32(rawSum / 1000.0);
engine.global-extra-added @@ engine/EngineStatistics.cpp @@ SaturateToU32(globalSum / 1000.0 + 0.5) - rawCost @@ SaturateToU32(globalSum / 1000.0 + 0.5) + rawCost
engine.jitter-mode-lost @@ engine/EngineStatistics.cpp @@ stats.jitterMode.store(mode, std::memory_order_relaxed); @@ stats.jitterMode.store(0, std::memory_order_relaxed);
engine.histogram-tie-later @@ engine/EngineStatistics.cpp @@ if (n > counters[mode]) mode = b; @@ if (n >= counters[mode]) mode = b;
# --- start-up (engine/LibraryFrame.cpp) ---
start.first-tick-at-once @@ engine/LibraryFrame.cpp @@ const uint64_t first = ToU64(now) + gTickPeriod.Load(); @@ const uint64_t first = ToU64(now);
start.first-tick-late @@ engine/LibraryFrame.cpp @@ const uint64_t first = ToU64(now) + gTickPeriod.Load(); @@ const uint64_t first = ToU64(now) + 3 * gTickPeriod.Load();
start.no-epoch-offset @@ engine/LibraryFrame.cpp @@     engine->SetEpochOffset(ComputeEpochOffset()); @@     (void)0;
# --- timer (source/os_extensions/nsengine) ---
timer.wakes-before-start @@ source/os_extensions/nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.cpp @@ return state.threadId.load() >= 0 && !OnTimerThread(); @@ return !OnTimerThread();
timer.deadline-kept @@ source/os_extensions/nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.cpp @@         state->expiry = TimerTimespec{kParkedSeconds, 0};<NL> @@ <NL>
timer.fires-when-woken @@ source/os_extensions/nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.cpp @@ if (SleepUntil(*state, snapshot, takenCount, deadline) == PalSleepResult::kDeadline) { @@ if (SleepUntil(*state, snapshot, takenCount, deadline) != PalSleepResult::kFailed) {
timer.nanoseconds-lost @@ source/os_extensions/nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.cpp @@ state.expiry.tv_nsec = static_cast<int32_t>(ns - seconds * kNsPerSecond); @@ state.expiry.tv_nsec = 0;
# --- semaphores (include/quelta/RuntimeSemaphore.h, shared by the platform layer) ---
semaphore.trim-last-post @@ include/quelta/RuntimeSemaphore.h @@ if (s->count - s->waiters > 1) --s->count; @@ if (s->count - s->waiters >= 1) --s->count;
semaphore.never-trimmed @@ include/quelta/RuntimeSemaphore.h @@ if (s->count - s->waiters > 1) --s->count; @@ (void)0;
semaphore.posts-unbounded @@ include/quelta/RuntimeSemaphore.h @@ if (s->count <= s->waiters) ++s->count; @@ ++s->count;
semaphore.timed-out-takes @@ include/quelta/RuntimeSemaphore.h @@ result = abandoned ? 3 : rc == ETIMEDOUT ? 1 : 2; @@ result = abandoned ? 3 : rc == ETIMEDOUT ? 1 : 2;<NL>        if (s->count != 0 && !abandoned) { --s->count; result = 0; }
# --- the stop (engine/LibraryUse.cpp) ---
stop.unlisted-never-looks @@ engine/LibraryUse.cpp @@ r = WaitInSlices(semaphore, deadline); @@ r = PalSemaphoreWaitUntilUnless(semaphore, deadline, &Stopping);
# --- the kernel extension's calls, through its emulation (tests/kext) ---
timer.blind-sleep-unbounded @@ source/os_extensions/nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.cpp @@ const timespec until = Earliest(deadline, bound); @@ const timespec until = deadline;
timer.late-wake-parks @@ source/os_extensions/nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.cpp @@             if (ExpirySetSince(state, takenCount)) return result;<NL>            continue; @@             return result;
timer.deferred-wake-dropped @@ source/os_extensions/nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.cpp @@     for (; tOwedWakes != 0; --tOwedWakes) tOwedTimer->WakeDeferred(); @@     tOwedWakes = 0;
list.placement-unchecked @@ engine/WaitList.cpp @@ if (!place.found || place.version != gWaitListVersion.load(kRelaxed)) place = @@ if (!place.found) place =
list.unlink-unversioned @@ engine/WaitList.cpp @@     gWaitListVersion.fetch_add(1, std::memory_order_release);<NL>    CountQueued(node, -1); @@     CountQueued(node, -1);
tick.idle-global-unconverted @@ engine/TickService.cpp @@ if (!needGlobal && GlobalNodesQueued()) continue; @@ (void)needGlobal;
kext.convert-time-first @@ engine/SystemClock.cpp @@ return syscall(number, static_cast<long>(fromClock), static_cast<long>(toClock), time); @@ return syscall(number, time, static_cast<long>(fromClock), static_cast<long>(toClock));
kext.convert-direction-swapped @@ engine/EngineConversion.cpp @@ ConvertClockTime(CLOCK_MONOTONIC, CLOCK_REALTIME, &ts); @@ ConvertClockTime(CLOCK_REALTIME, CLOCK_MONOTONIC, &ts);
kext.wake-wrong-id @@ source/os_extensions/nsengine/tKPusLinuxNanoSleepTimer/tKPusLinuxNanoSleepTimer.cpp @@ if (nr >= 1) return static_cast<int32_t>(syscall(nr, state.threadId.load())); @@ if (nr >= 1) return static_cast<int32_t>(syscall(nr, getpid()));
i686.kext.convert-timespec-64 @@ engine/EngineConversion.cpp @@     KernelTimespec k{static_cast<long>(time->tv_sec), time->tv_nsec};<NL>    const long r = gSystemClock.convertTime(nr, fromClock, toClock, &k);<NL>    if (r == -1 && errno == EOVERFLOW) return false;<NL>    time->tv_sec = static_cast<time_t>(k.tv_sec);<NL>    time->tv_nsec = k.tv_nsec; @@     const long r = gSystemClock.convertTime(nr, fromClock, toClock, reinterpret_cast<KernelTimespec*>(time));<NL>    if (r == -1 && errno == EOVERFLOW) return false;
# --- log engine (log/tKPLogEngine.cpp) ---
log.adjust-not-atomic @@ log/tKPLogEngine.cpp @@ static_cast<uint32_t>(enableCount.fetch_add(delta, kRelaxed)) @@ static_cast<uint32_t>(enableCount.exchange(enableCount.load(kRelaxed) + delta, kRelaxed))
# --- the event log (log/...) ---
log.cursor-one-ahead @@ log/LogHandOff.h @@ uint32_t pos = published.writeIndex - 1; @@ uint32_t pos = published.writeIndex;
log.wrap-count-ignored @@ log/LogHandOff.h @@ uint32_t remaining = published.wrapCount != 0 ? capacity : published.writeIndex; @@ uint32_t remaining = published.writeIndex;
log.wrap-skips-slot-zero @@ log/LogHandOff.h @@ if (wraps) slot = 0; @@ if (wraps) slot = 1;
log.check-not-verified @@ log/LogHandOff.h @@ return A::Load(entry.check, A::kRelaxed) == LogEntryCheck(out.low, out.high, out.event, out.data); @@ return true;
log.enable-not-nesting @@ log/tKPLogEngine.cpp @@ enabled.store(static_cast<int32_t>(count) > 0 ? enableValue.load(kRelaxed) : 0, kRelaxed); @@ enabled.store(delta > 0 ? enableValue.load(kRelaxed) : 0, kRelaxed);
log.merge-tie-higher-cpu @@ log/LogMerge.h @@ (stored == key && losers[index] < who) @@ (stored == key && losers[index] > who)
log.far-past-selected @@ log/LogMerge.h @@ leaf.key = key > OrderKey(0) ? key : kLogNoHead; @@ leaf.key = key != OrderKey(0) ? key : kLogNoHead;
EOF
}

# id, file, from, to on separate lines of stdout for each selected mutant.
selected() {
  mutants | grep -v '^\s*#' | grep -v '^\s*$' | awk -F ' @@ ' -v only="$only" '
    BEGIN { n = split(only, want, ","); for (i = 1; i <= n; i++) pick[want[i]] = 1 }
    { if (NF != 4) { print "malformed: " $0 > "/dev/stderr"; exit 2 }
      if (only == "" || ($1 in pick)) printf "%s\t%s\t%s\t%s\n", $1, $2, $3, $4 }'
}

# Replaces the one occurrence of FROM by TO in file $1 (else exit 3, file kept).
replace_once() {
  perl -e '
    my ($file) = @ARGV;
    my ($from, $to) = @ENV{qw(FROM TO)};
    s/<NL>/\n/g for $from, $to;
    local $/; open(my $in, "<", $file) or die "$file: $!"; my $s = <$in>; close $in;
    my $i = index($s, $from);
    exit 3 if $i < 0 || index($s, $from, $i + 1) >= 0;
    substr($s, $i, length $from) = $to;
    open(my $out, ">", $file) or die "$file: $!"; print $out $s; close $out;' "$1"
}

if [ $list_only = 1 ]; then
  selected | awk -F '\t' '{ printf "%-34s %s\n", $1, $2 }'
  exit 0
fi

# --check: every original text occurs exactly once (checked in a scratch copy).
stale=0 total=0
scratch=$(mktemp)
trap 'rm -f "$scratch"' EXIT
while IFS=$'\t' read -r id file from to; do
  total=$((total + 1))
  if [ ! -f "$root/$file" ]; then echo "stale: $id ($file missing)"; stale=$((stale + 1)); continue; fi
  cp "$root/$file" "$scratch"
  FROM=$from TO=$to replace_once "$scratch" || { echo "stale: $id (text not found exactly once in $file)"; stale=$((stale + 1)); }
done < <(selected)
[ $stale -eq 0 ] || { echo "$stale of $total mutants are stale: update the list" >&2; exit 1; }
if [ $check_only = 1 ]; then echo "$total mutants, all apply"; exit 0; fi

# --- a copy of the tree of our own, built in a directory of our own ---------
mkdir -p "$work"
rm -rf "$work/src" "$work/logs"
mkdir -p "$work/src" "$work/logs"
# -m: a build left by an interrupted run (of a mutated file) is older than the copy.
tar -C "$root" --exclude=./build --exclude=./.git -cf - . | tar -C "$work/src" -xmf -
current=""  # the file of the copy that carries a mutant right now
restore() {
  if [ -n "$current" ]; then cp "$work/original" "$work/src/$current"; current=""; fi
}
trap 'restore; rm -f "$scratch"; exit 130' INT TERM
trap 'restore; rm -f "$scratch"' EXIT

build() {  # build directory, log
  cmake --build "$1" -j "$jobs" >"$2" 2>&1
}
# The build a mutant is made in: i686 for the i686 ones, native otherwise.
dir_of() { case $1 in i686.*) echo "$work/build-i686" ;; *) echo "$work/build" ;; esac; }
configure() {  # build directory, log name, extra cmake arguments...
  local dir=$1 name=$2; shift 2
  echo "configuring and building the copy in $dir"
  # Optimised as the suite's stages; no debug information (it slows the rebuilds).
  cmake -S "$work/src" -B "$dir" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
    -DCMAKE_CXX_FLAGS_RELWITHDEBINFO="-O2 -DNDEBUG" -DCMAKE_C_FLAGS_RELWITHDEBINFO="-O2 -DNDEBUG" \
    -DQUELTA_BUILD_BENCH=OFF -DQUELTA_BUILD_TOOLS=OFF "$@" >"$work/logs/configure-$name.log" 2>&1 \
    || { echo "configure failed: $work/logs/configure-$name.log" >&2; exit 1; }
  build "$dir" "$work/logs/baseline-build-$name.log" || { echo "the unmutated tree does not build ($name)" >&2; exit 1; }
}
configure "$work/build" native
needs_i686=0
selected | cut -f1 | grep -q '^i686\.' && needs_i686=1
[ $needs_i686 = 1 ] && configure "$work/build-i686" i686 -DCMAKE_TOOLCHAIN_FILE="$work/src/cmake/i686-linux-gnu.cmake"

# The 32-thread stress test runs 5 s per mutant instead of 20.
export QUELTA_STRESS_SECONDS=${QUELTA_STRESS_SECONDS:-5}
stages=(unit 'rt|integration|kext')
stages_of() { case $1 in "$work/build-i686") echo kext ;; *) echo "${stages[@]}" ;; esac; }
stage_timeout() { [ "$1" = unit ] && echo 240 || echo 480; }

# Runs stage $1 (label regex) of build $4, logging to $2, leaving out $3;
# prints the failing tests (or "timeout") and returns 1 when a test failed.
run_stage() {
  local label=$1 log=$2 exclude=$3 dir=$4 args=()
  [ -n "$exclude" ] && args=(-E "$exclude")
  [ -n "$tests" ] && args+=(-R "$tests")
  [ $all_killers = 1 ] || args+=(--stop-on-failure)
  local start
  start=$(wc -l <"$log")
  # 4 GB of address space per test stops a mutant's runaway allocation.
  (ulimit -v 4194304
   timeout -k 10 "$(stage_timeout "$label")" ctest --test-dir "$dir" -L "$label" -LE 'long|hostclock' \
     --output-on-failure "${args[@]}") >>"$log" 2>&1
  local rc=$?
  if [ $rc -eq 124 ] || [ $rc -eq 137 ]; then echo timeout; return 1; fi
  if [ $rc -ne 0 ]; then
    local t
    t=$(tail -n +$((start + 1)) "$log" | sed -n 's/.*Test *#[0-9]*: \([^ ]*\) .*\*\*\*.*/\1/p' | sort -u | paste -sd, -)
    echo "${t:-ctest}"; return 1
  fi
  return 0
}

# Prints the exclusion regex of build $1: the tests that fail without a mutant.
baseline() {
  local dir=$1 name=native label failing=()
  [ "$dir" = "$work/build" ] || name=i686
  for label in $(stages_of "$dir"); do
    (ulimit -v 4194304; timeout -k 10 600 ctest --test-dir "$dir" -L "$label" -LE 'long|hostclock' ${tests:+-R "$tests"}) \
      >"$work/logs/baseline-$name-$([ "$label" = unit ] && echo unit || echo rest).log" 2>&1
  done
  while read -r t; do failing+=("$t"); done < <(sed -n 's/.*Test *#[0-9]*: \([^ ]*\) .*\*\*\*.*/\1/p' "$work"/logs/baseline-"$name"-*.log)
  if [ ${#failing[@]} -gt 0 ]; then
    echo "left out in $name (failing without a mutant): ${failing[*]}" >&2
    echo "^($(IFS='|'; echo "${failing[*]}"))\$"
  fi
}
echo "baseline run (tests that fail here are left out)"
exclude=$(baseline "$work/build")
exclude_i686=""
[ $needs_i686 = 1 ] && exclude_i686=$(baseline "$work/build-i686")

killed=0 survived=0 invalid=0
report=$work/report.txt
: >"$report"
while IFS=$'\t' read -r id file from to; do
  log=$work/logs/$id.log
  cp "$work/src/$file" "$work/original"
  current=$file
  FROM=$from TO=$to replace_once "$work/src/$file"
  dir=$(dir_of "$id")
  excluded=$exclude; [ "$dir" = "$work/build" ] || excluded=$exclude_i686
  if ! build "$dir" "$log"; then
    result="does-not-compile"; invalid=$((invalid + 1))
  else
    result=""
    for label in $(stages_of "$dir"); do
      if killer=$(run_stage "$label" "$log" "$excluded" "$dir"); then continue; fi
      result="${result:+$result,}$killer"
      [ $all_killers = 1 ] || break
    done
    [ -z "$result" ] || result="killed by $result"
    if [ -z "$result" ]; then result="SURVIVED"; survived=$((survived + 1)); else killed=$((killed + 1)); fi
  fi
  restore
  printf '%-34s %s\n' "$id" "$result" | tee -a "$report"
done < <(selected)

# Leave the copy's builds matching the tree.
build "$work/build" "$work/logs/restore-build.log"
[ $needs_i686 = 1 ] && build "$work/build-i686" "$work/logs/restore-build-i686.log"
counted=$((killed + survived))
if [ $counted -gt 0 ]; then
  score=$(awk -v k=$killed -v n=$counted 'BEGIN { printf "%.1f", 100 * k / n }')
else
  score=0
fi
echo "mutation score: $killed of $counted killed ($score %), $survived survived, $invalid did not compile" | tee -a "$report"
echo "report: $report, logs: $work/logs/"
