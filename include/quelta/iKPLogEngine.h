/**
 * \file
 * \brief iKPLogEngine: the per-CPU event log as the runtime sees it.
 *
 * The runtime calls this object by virtual-slot position: 24 operations in
 * the order below, then the destructor (slots 24 and 25). Never reorder.
 *
 * In C the log engine is an opaque type; its slots are reached from C++.
 */
#ifndef QUELTA_IKPLOGENGINE_H
#define QUELTA_IKPLOGENGINE_H

#include "quelta/ClockTime.h"

#ifdef __cplusplus

/**
 * \brief The event log: time-stamped 32-bit events recorded per CPU without
 *        locks, read out merged in time order.
 *
 * The library creates one log engine when it is loaded and deletes it when it
 * is unloaded; GetLogEngine__MERIDOX() lends it out. The library records
 * nothing itself.
 *
 * **Entries.** An entry is a time (ClockTime), an event word and a data word.
 * The log's own time stamps are global time (ReadGlobal7 of the engine:
 * nanoseconds since 1904-01-01 on `CLOCK_REALTIME`); the operations that take
 * a time store the caller's value as given. On read-out, bits 8 to 15 of the
 * event word are replaced by the index of the CPU that recorded it, so only
 * bits 0 to 7 and 16 to 31 of the caller's word reach the reader. The data
 * word is 0xFFFFFFFF unless the operation says otherwise.
 *
 * **Recording** picks the ring of the CPU the calling thread runs on
 * (`sched_getcpu`) and costs a few stores: no lock, no atomic
 * read-modify-write, no allocation, no system call beyond the clock read of
 * the operations that stamp the time. Any thread may record, callbacks on the
 * timer thread included. Each CPU keeps its newest entries (5000 by default);
 * older ones are overwritten. Two threads recording on one CPU at the same
 * moment (one preempted between choosing its slot and writing it) may
 * overwrite each other's entry.
 *
 * **Switching.** A new log records nothing until it is switched on
 * (SetEnabled(), AdjustEnabled(), SetEnableValue() or SetEnabledWord()). The
 * enabled word is 0 (off) or a key; the keyed operations record only when
 * their key equals it.
 *
 * **Read-out and reconfiguration** (Configure(), Reconfigure(), ReadOut7(),
 * ReadOutMerged()) are serialised with each other by a lock of the log
 * engine, so they block while another of them runs; recording never takes
 * that lock. They must not be called from a callback on the timer thread.
 */
class QUELTA_EXPORT iKPLogEngine {
public:
    /**
     * \brief Slot 0: rebuilds every ring with a new capacity and empties the
     *        log.
     *
     * Switches recording off (the count and the enable value stay), pauses
     * 1 ms so that recorders in flight finish, then gives every CPU's rings
     * the new capacity. A ring whose capacity is already right is kept and
     * emptied. Allocates: not for a timing path.
     * \param capacity entries per CPU ring; -1 the default, 5000. 0 leaves
     *        each ring on a 10-entry area inside the engine. A capacity of
     *        2^28 or more, or another negative value, is not allocated and
     *        gives the 10-entry rings.
     * \return the capacity in force; 10 when a ring could not be allocated
     *         (that ring then has 10 entries, the others the capacity asked).
     */
    virtual uint32_t Configure(int32_t capacity) = 0;                          // 0
    /**
     * \brief Slot 1: records an event with the caller's time.
     * \param time stored as given (not checked; a time of 0, or one whose
     *        high word is 0xFFFFFFFF, is never read out).
     * \param event the event word.
     */
    virtual void LogAt1(const ClockTime& time, uint32_t event) = 0;            // 1
    /** \brief Slot 2: the same as slot 1, LogAt1(). \param time stored as given. \param event the event word. */
    virtual void LogAt2(const ClockTime& time, uint32_t event) = 0;            // 2
    /**
     * \brief Slot 3: stamps the global time now into time, then records it.
     *
     * The clock is read and handed back even while recording is off.
     * \param[out] time receives the global time now.
     * \param event the event word.
     */
    virtual void StampAndLog3(ClockTime& time, uint32_t event) = 0;            // 3
    /** \brief Slot 4: the same as slot 3, StampAndLog3(). \param[out] time receives the global time now. \param event the event word. */
    virtual void StampAndLog4(ClockTime& time, uint32_t event) = 0;            // 4
    /**
     * \brief Slot 5: records an event at the global time now.
     *
     * Reads the clock even while recording is off (about one clock read,
     * 30 ns).
     * \param event the event word.
     */
    virtual void LogNow5(uint32_t event) = 0;                                  // 5
    /** \brief Slot 6: the same as slot 5, LogNow5(). \param event the event word. */
    virtual void LogNow6(uint32_t event) = 0;                                  // 6
    /**
     * \brief Slot 7: ReadOutMerged() without the data array.
     * \param[in,out] count in: the room of the arrays; out: entries written.
     * \param timeLow receives the low words of the times.
     * \param timeHigh receives the high words of the times.
     * \param events receives the event words, CPU index in bits 8 to 15.
     * \param last not used.
     */
    virtual void ReadOut7(uint32_t& count, uint32_t timeLow[],
                          uint32_t timeHigh[], uint32_t events[],
                          uint32_t last) = 0;                                  // 7
    /**
     * \brief Slot 8: sets the enabled word directly.
     * \param value 0 switches recording off; any other value switches it on
     *        with that key.
     */
    virtual void SetEnabledWord(uint32_t value) = 0;                           // 8
    /** \brief Slot 9: does nothing. */
    virtual void NoOperation9() = 0;                                           // 9
    /** \brief Slot 10: does nothing. */
    virtual void NoOperation10() = 0;                                          // 10
    /**
     * \brief Slot 11: sets the enable count.
     * \param n the count; nonzero switches recording on with the enable value
     *        (1 unless SetEnableValue() changed it), 0 switches it off.
     */
    virtual void SetEnabled(uint32_t n) = 0;                                   // 11
    /**
     * \brief Slot 12: changes the enable count, for nested switching.
     * \param delta added to the count; recording is on with the enable value
     *        while the count is above 0 (signed), off otherwise.
     */
    virtual void AdjustEnabled(int32_t delta) = 0;                             // 12
    /**
     * \brief Slot 13: sets the enable value and switches on with it.
     * \param value the key that SetEnabled() and AdjustEnabled() switch on
     *        with from now on; it also becomes the enabled word at once
     *        (0: off).
     */
    virtual void SetEnableValue(uint32_t value) = 0;                           // 13
    /**
     * \brief Slot 14: makes another, independent log engine.
     *
     * Constructed like the library's own (default capacity, recording off).
     * Allocates. The caller owns it and deletes it (slot 25) before the
     * library is unloaded.
     * \return the new engine; null if it could not be allocated.
     */
    virtual iKPLogEngine* CreateLogEngine() = 0;                               // 14
    /**
     * \brief Slot 15: LogAt1() only if the enabled word equals key.
     * \param time stored as given.
     * \param event the event word.
     * \param key compared with the enabled word; 0 never records.
     */
    virtual void LogAtIfKey15(const ClockTime& time, uint32_t event,
                              uint32_t key) = 0;                               // 15
    /** \brief Slot 16: the same as slot 15, LogAtIfKey15(). \param time stored as given. \param event the event word. \param key compared with the enabled word. */
    virtual void LogAtIfKey16(const ClockTime& time, uint32_t event,
                              uint32_t key) = 0;                               // 16
    /**
     * \brief Slot 17: LogNow5() only if the enabled word equals key (no clock
     *        read otherwise).
     * \param event the event word.
     * \param key compared with the enabled word; 0 never records.
     */
    virtual void LogNowIfKey17(uint32_t event, uint32_t key) = 0;              // 17
    /** \brief Slot 18: the same as slot 17, LogNowIfKey17(). \param event the event word. \param key compared with the enabled word. */
    virtual void LogNowIfKey18(uint32_t event, uint32_t key) = 0;              // 18
    /**
     * \brief Slot 19: empties the log and switches recording off:
     *        Configure() with the capacity in force.
     */
    virtual void Reconfigure() = 0;                                            // 19
    /**
     * \brief Slot 20: records an event with the caller's time and data word.
     * \param time stored as given.
     * \param data the data word, read out by ReadOutMerged().
     * \param event the event word.
     */
    virtual void LogAtWithData(const ClockTime& time, uint32_t data,
                               uint32_t event) = 0;                            // 20
    /** \brief Slot 21: LogNow5() with data word 256. \param event the event word. */
    virtual void LogNowData256(uint32_t event) = 0;                            // 21
    /** \brief Slot 22: LogNow5() with data word 0. \param event the event word. */
    virtual void LogNowData0(uint32_t event) = 0;                              // 22
    /**
     * \brief Slot 23: reads out the newest entries of all CPUs, merged in
     *        time order.
     *
     * Redirects recording to the second bank of rings while it reads the
     * first, then points recording back; entries recorded during the
     * read-out are lost. It does not consume entries: the next read-out
     * returns them again while they are not overwritten. No allocation;
     * costs about count × log2(CPUs) comparisons. Blocks while another
     * read-out or reconfiguration runs. An entry that a recorder was still
     * writing (or that two recorders on one CPU tore) is left out.
     * \param[in,out] count in: the room of the arrays (not checked); out: the
     *        entries written, at most the number held (fewer when entries are
     *        left out as torn; the written ones are then at 0..count-1). 0
     *        writes nothing and starts the log afresh: the entries held
     *        before no longer appear.
     * \param timeLow receives the low words of the times, oldest at index 0,
     *        newest at count - 1; among equal times the lower CPU comes later.
     * \param timeHigh receives the high words of the times.
     * \param events receives the event words, with the recording CPU's index
     *        in bits 8 to 15.
     * \param data receives the data words; may be null.
     * \param last not used.
     */
    virtual void ReadOutMerged(uint32_t& count, uint32_t timeLow[],
                               uint32_t timeHigh[], uint32_t events[],
                               uint32_t data[], uint32_t last) = 0;            // 23
    /**
     * \brief Slots 24 and 25: the destructors.
     *
     * The runtime deletes only engines it made with CreateLogEngine(), never
     * the one from GetLogEngine__MERIDOX().
     */
    virtual ~iKPLogEngine() {}                                                 // 24, 25
};

#else
/** \brief In C, the log engine is opaque. */
typedef struct iKPLogEngine iKPLogEngine;
#endif

#endif
