/* Drives the calling thread's timer heap with operations decoded from bytes
 * and compares it, after every step and in every expiry callback, with a
 * reference binary heap of the same records: 1-based, slot 0 unused, a timer
 * moves only past a strictly earlier or later neighbour, and of two equal
 * children the right one goes up. Shared by the seeded test and the fuzzer. */
#ifndef QORBU_TESTS_SELECTOR_HEAP_INTERPRETER_H
#define QORBU_TESTS_SELECTOR_HEAP_INTERPRETER_H

#include <csignal>
#include <string>
#include <vector>

#include "selector/sel_private.h"

namespace qorbu::test {

class HeapInterpreter {
  public:
    /* Empties the heap, then runs one operation per three bytes (operation,
     * record, parameter). Returns "" or the first difference found. */
    std::string run(const uint8_t *data, size_t size) {
        ctx_ = SelCurrentContext();
        SelRemoveAllTimers();
        std::signal(SIGQUIT, SIG_IGN); /* a refused SelAddTimer raises it in the whole process */
        model_.assign(1, nullptr), error_.clear();
        timespec now;
        SelGetTime(&now);
        past_ = now.tv_sec - 100, future_ = now.tv_sec + 100000;
        for (SelTimer &t : records_) t = SelTimer{0, {}, fire, this};
        for (step_ = 0; 3 * step_ + 3 <= size && error_.empty(); ++step_, check())
            apply(data[3 * step_] % 8, records_[data[3 * step_ + 1] % std::size(records_)],
                  data[3 * step_ + 2]);
        return error_;
    }

  private:
    static bool earlier(const timespec &a, const timespec &b) {
        return a.tv_sec < b.tv_sec || (a.tv_sec == b.tv_sec && a.tv_nsec < b.tv_nsec);
    }
    static bool earlier(const SelTimer *a, const SelTimer *b) { return earlier(a->when, b->when); }
    static long long ns(const timespec &w) { return w.tv_sec * 1000000000LL + w.tv_nsec; }
    void apply(int op, SelTimer &t, uint8_t p) {
        /* Few deadlines, so that equal ones are common: negative, past and
         * future seconds, each with four nanosecond values. */
        static constexpr long kNsec[] = {0, 1, 500000000, 999999999};
        const time_t base = (p & 0x30) == 0 ? -2 : (p & 0x30) == 0x10 ? past_ : future_;
        const timespec old = t.when, when = {static_cast<time_t>(base + ((p >> 2) & 3)), kNsec[p & 3]};
        if (op <= 1) { /* arms a free record; an armed one, or one without a callback, is refused */
            if (SelAddTimer(t.heapIndex != 0 ? &t : &unusable_) != -117) return fail("misuse accepted");
            if (t.heapIndex != 0) return;
            t.when = when;
            return SelAddTimer(&t) == 0 ? add(&t) : fail("SelAddTimer failed");
        }
        if (op == 2 || (op == 7 && p >= 32)) return SelRemTimer(&t), remove(&t);
        if (op == 3) return SelModifyTimer(&t, &when) == 0 ? modify(&t, old) : fail("SelModifyTimer failed");
        if (op == 5) return expire(p & 0x80 ? p & 0x7f : 0);
        if (op == 6 && SelDebugIsTimerActive(&t) != (slot_of(&t) != 0)) return fail("SelDebugIsTimerActive");
        if (op == 7 && SelRemoveAllTimers() + 1 != static_cast<int>(model_.size())) fail("RemoveAll");
        if (op == 7) model_.resize(1);
        if (op != 4) return;
        const unsigned ms = p & 1 ? 0u : 3600000u + p * 7919u; /* due at once, or in an hour or more */
        timespec lo, hi;
        SelGetTime(&lo);
        const int result = SelSleep(&t, ms);
        SelGetTime(&hi);
        if (result != 0 || t.when.tv_nsec < 0 || t.when.tv_nsec > 999999999 ||
            ns(t.when) < ns(lo) + ms * 1000000LL || ns(t.when) > ns(hi) + ms * 1000000LL)
            return fail("SelSleep");
        modify(&t, old);
    }
    /* One expiry run; each fired timer re-arms itself for the present while
     * the budget lasts, so that the run's limit of 101 is reached now and then. */
    void expire(int budget) {
        budget_ = budget, fired_ = 0;
        const int fired = SelRunTimers(ctx_);
        timespec now;
        SelGetTime(&now);
        if (fired != fired_ || fired > 101) fail("expiry run count");
        if (fired < 101 && model_.size() > 1 && !earlier(now, model_[1]->when)) fail("a due timer left");
    }
    static int fire(SelTimer *t) { return static_cast<HeapInterpreter *>(t->arg)->fired(t), 0; }
    void fired(SelTimer *t) {
        ++fired_;
        if (ctx_->timerHeap[0] != t || t->heapIndex != 0) fail("fired timer not parked in slot 0, disarmed");
        if (model_.size() < 2 || model_[1] != t) return fail("fired out of order");
        remove(t), check();
        if (budget_-- <= 0) return;
        if (SelSleep(t, 0) != 0) fail("re-arming in the callback failed");
        add(t);
    }
    /* The reference heap. */
    size_t slot_of(const SelTimer *t) const {
        for (size_t i = 1; i < model_.size(); ++i)
            if (model_[i] == t) return i;
        return 0;
    }
    void up(size_t i) {
        SelTimer *t = model_[i];
        for (; i > 1 && earlier(t, model_[i / 2]); i /= 2) model_[i] = model_[i / 2];
        model_[i] = t;
    }
    void down(size_t i) {
        SelTimer *t = model_[i];
        for (size_t l = 2 * i, n = model_.size() - 1, c; l <= n; i = c, l = 2 * i) {
            if (l < n && (earlier(model_[l], t) || earlier(model_[l + 1], t)))
                c = earlier(model_[l], model_[l + 1]) ? l : l + 1;
            else if (earlier(model_[l], t))
                c = l;
            else
                break;
            model_[i] = model_[c];
        }
        model_[i] = t;
    }
    void add(SelTimer *t) { model_.push_back(t), up(model_.size() - 1); }
    void remove(SelTimer *t) {
        const size_t i = slot_of(t);
        SelTimer *last = model_.back();
        if (i == 0 || (model_.pop_back(), i == model_.size())) return;
        model_[i] = last;
        i > 1 && earlier(last, model_[i / 2]) ? up(i) : down(i);
    }
    void modify(SelTimer *t, const timespec &old) {
        const size_t i = slot_of(t);
        if (i == 0) return add(t);
        earlier(old, t->when) ? down(i) : up(i);
    }
    void check() {
        const int n = static_cast<int>(model_.size()) - 1;
        if (ctx_->timerCount != n || n > ctx_->timerCapacity) return fail("timerCount or timerCapacity");
        if (n == 0 && ctx_->timerHeap[1] != nullptr) return fail("slot 1 of an empty heap not null");
        for (int i = 1; i <= n; ++i)
            if (ctx_->timerHeap[i] != model_[i]) return fail("slot " + std::to_string(i));
        for (const SelTimer &t : records_)
            if (t.heapIndex != slot_of(&t))
                return fail("heapIndex of record " + std::to_string(&t - records_));
    }
    void fail(const std::string &what) {
        if (error_.empty()) error_ = "step " + std::to_string(step_) + ": " + what;
    }

    SelContext *ctx_ = nullptr;
    SelTimer records_[24]{}, unusable_{};
    std::vector<SelTimer *> model_;
    time_t past_ = 0, future_ = 0;
    int budget_ = 0, fired_ = 0;
    size_t step_ = 0;
    std::string error_;
};

} // namespace qorbu::test

#endif
