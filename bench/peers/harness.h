// Side-by-side comparison harness: runs every contender of a figure in the
// same process, interleaved (the order rotates from one repetition to the
// next), repeats each figure and keeps the median. Each driver fills
// Sections and writes them as a Markdown fragment, a gnuplot data file and a
// gnuplot script; scripts/bench.sh stitches the fragments into BENCHMARKS.md.
#pragma once

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <string>
#include <time.h>
#include <vector>

namespace bench {

inline double clock_ns(clockid_t id) {
    struct timespec ts;
    clock_gettime(id, &ts);
    return double(ts.tv_sec) * 1e9 + double(ts.tv_nsec);
}

// Samples are timed on the thread's CPU-time clock by default: on a shared
// machine, time spent descheduled while other work runs is then not counted
// (nothing timed here ever blocks). --clock=wall switches to the monotonic
// clock; figures of several processes always use it.
inline clockid_t &sample_clock() {
    static clockid_t id = CLOCK_THREAD_CPUTIME_ID;
    return id;
}
inline double now_ns() { return clock_ns(sample_clock()); }
inline double wall_ns() { return clock_ns(CLOCK_MONOTONIC); }

// Keeps the compiler from dropping work whose result is otherwise unused.
template <class T> inline void keep(T const &value) { asm volatile("" : : "r,m"(value) : "memory"); }

// Command-line knobs shared by every driver.
struct Options {
    int reps = 7;                 // repetitions per figure (median of these)
    double sample_ms = 20;        // target duration of one timed sample
    double scale = 1.0;           // <1 for a quick smoke run
    std::string out_dir = ".";    // where fragments, data and plot scripts go
    std::string only;             // run only contenders whose name contains this (profiling)

    static Options parse(int argc, char **argv) {
        Options o;
        for (int i = 1; i < argc; ++i) {
            std::string a = argv[i];
            auto value = [&](const char *name) -> const char * {
                size_t n = strlen(name);
                return a.compare(0, n, name) == 0 ? a.c_str() + n : nullptr;
            };
            if (const char *v = value("--reps=")) o.reps = std::max(1, atoi(v));
            else if (const char *v = value("--sample-ms=")) o.sample_ms = atof(v);
            else if (const char *v = value("--scale=")) o.scale = atof(v);
            else if (const char *v = value("--out=")) o.out_dir = v;
            else if (const char *v = value("--only=")) o.only = v;
            else if (const char *v = value("--clock=")) sample_clock() = strcmp(v, "wall") == 0 ? CLOCK_MONOTONIC : CLOCK_THREAD_CPUTIME_ID;
            else {
                fprintf(stderr, "usage: %s [--reps=N] [--sample-ms=MS] [--scale=F] [--out=DIR] [--clock=cpu|wall] [--only=NAME]\n", argv[0]);
                exit(2);
            }
        }
        return o;
    }
};

enum class Role { Ours, Peer, Floor };

// One contender of a figure: run() performs one timed sample and returns the
// cost of one operation in nanoseconds.
struct Contender {
    std::string name;
    Role role;
    std::function<double()> run;
};

inline double median(std::vector<double> v) {
    if (v.empty()) return NAN;
    std::sort(v.begin(), v.end());
    size_t n = v.size();
    return n % 2 ? v[n / 2] : (v[n / 2 - 1] + v[n / 2]) / 2;
}

// Runs reps rounds; in round r the contenders start at index r (rotation), so
// none is always first after a cold start or always last on a warm cache.
inline std::vector<double> interleave(const Options &o, std::vector<Contender> &cs,
                                      std::vector<std::vector<double>> *all = nullptr) {
    std::vector<std::vector<double>> samples(cs.size());
    for (int r = 0; r < o.reps; ++r)
        for (size_t k = 0; k < cs.size(); ++k) {
            size_t i = (k + size_t(r)) % cs.size();
            if (!o.only.empty() && cs[i].name.find(o.only) == std::string::npos) continue;
            samples[i].push_back(cs[i].run());
        }
    std::vector<double> med;
    for (auto &s : samples) med.push_back(median(s));
    if (all) *all = samples;
    return med;
}

// Calibrates an operation count once (so that one sample lasts about
// sample_ms), then times `body(count)` per sample. body returns the number of
// operations it performed.
class Timed {
  public:
    Timed(const Options &o, std::function<long(long)> body, long min_ops = 16)
        : opt_(o), body_(std::move(body)), min_ops_(min_ops) {}
    double operator()() {
        if (ops_ == 0) calibrate();
        double t0 = now_ns();
        long done = body_(ops_);
        double t1 = now_ns();
        return (t1 - t0) / double(done);
    }

  private:
    void calibrate() {
        long n = min_ops_;
        for (;;) {
            double t0 = now_ns();
            long done = body_(n);
            double dt = now_ns() - t0;
            double per = dt / double(done);
            double want = opt_.sample_ms * 1e6 * opt_.scale;
            if (dt > want / 4 || n > (1L << 40)) {
                ops_ = std::max(min_ops_, long(want / per));
                return;
            }
            n *= 4;
        }
    }
    const Options &opt_;
    std::function<long(long)> body_;
    long min_ops_;
    long ops_ = 0;
};

struct Column {
    std::string name;
    Role role;
};

struct Row {
    std::string label;   // first column of the table
    double x = NAN;      // abscissa of the plot; NaN rows are left out of it
    std::string series;  // rows of one series form one line per contender
    std::vector<double> median;
};

// One table (and one plot) of BENCHMARKS.md.
struct Section {
    std::string id;       // file stem: <id>.md, <id>.dat, <id>.gp, <id>.png
    std::string title;
    std::string what;     // one paragraph: what one operation is
    std::string row_head; // heading of the label column
    std::string xlabel;
    bool logx = false;
    std::vector<Column> columns;
    std::vector<Row> rows;
    std::vector<std::string> verdicts; // target lines, filled by the driver

    void add(std::string label, double x, std::string series, std::vector<double> med) {
        rows.push_back({std::move(label), x, std::move(series), std::move(med)});
    }
    int col(const std::string &name) const {
        for (size_t i = 0; i < columns.size(); ++i)
            if (columns[i].name == name) return int(i);
        fprintf(stderr, "no column %s in %s\n", name.c_str(), id.c_str());
        abort();
    }
    double at(size_t row, const std::string &name) const { return rows[row].median[size_t(col(name))]; }
    double best_peer(size_t row, std::string *who = nullptr) const {
        double best = NAN;
        for (size_t i = 0; i < columns.size(); ++i)
            if (columns[i].role == Role::Peer && !(rows[row].median[i] >= best)) {
                best = rows[row].median[i];
                if (who) *who = columns[i].name;
            }
        return best;
    }
};

inline std::string fmt(double ns) {
    char b[64];
    if (std::isnan(ns)) return "n/a";
    if (ns >= 100000) snprintf(b, sizeof b, "%.0f", ns);
    else if (ns >= 100) snprintf(b, sizeof b, "%.1f", ns);
    else snprintf(b, sizeof b, "%.2f", ns);
    return b;
}

inline std::string ratio(double r) {
    char b[32];
    if (std::isnan(r)) return "n/a";
    snprintf(b, sizeof b, "%.2fx", r);
    return b;
}

// A target line: the worst ratio of `ours` to `ref(row)` over the rows that
// `use` accepts, against the limit.
inline std::string check(const Section &s, const std::string &target, const std::string &ours,
                         const std::function<double(size_t)> &ref, double limit,
                         const std::function<bool(size_t)> &use = nullptr) {
    double worst = -1;
    std::string where;
    for (size_t r = 0; r < s.rows.size(); ++r) {
        if (use && !use(r)) continue;
        double q = s.at(r, ours) / ref(r);
        if (q > worst) {
            worst = q;
            where = s.rows[r].label;
        }
    }
    char b[512];
    snprintf(b, sizeof b, "%s: **%s** (worst ratio %.2fx at %s; limit %.2fx)", target.c_str(),
             worst <= limit ? "met" : "missed", worst, where.c_str(), limit);
    return b;
}

inline FILE *open_out(const Options &o, const std::string &name) {
    std::string path = o.out_dir + "/" + name;
    FILE *f = fopen(path.c_str(), "w");
    if (!f) {
        perror(path.c_str());
        exit(1);
    }
    return f;
}

inline void write_markdown(const Options &o, const Section &s) {
    FILE *f = open_out(o, s.id + ".md");
    fprintf(f, "### %s\n\n%s\n\n", s.title.c_str(), s.what.c_str());
    fprintf(f, "Median ns per operation over %d interleaved repetitions; in brackets the ratio to the best "
               "peer of the row.\n\n| %s |",
            o.reps, s.row_head.c_str());
    for (auto &c : s.columns) fprintf(f, " %s%s |", c.name.c_str(), c.role == Role::Floor ? " (floor)" : "");
    fprintf(f, " best peer |\n|---|");
    for (size_t i = 0; i <= s.columns.size(); ++i) fprintf(f, "---:|");
    fprintf(f, "\n");
    for (size_t r = 0; r < s.rows.size(); ++r) {
        std::string who;
        double best = s.best_peer(r, &who);
        fprintf(f, "| %s |", s.rows[r].label.c_str());
        for (size_t i = 0; i < s.columns.size(); ++i) {
            double m = s.rows[r].median[i];
            bool ours = s.columns[i].role == Role::Ours;
            fprintf(f, " %s%s (%s)%s |", ours ? "**" : "", fmt(m).c_str(), ratio(m / best).c_str(), ours ? "**" : "");
        }
        fprintf(f, " %s |\n", who.empty() ? "-" : who.c_str());
    }
    bool plotted = std::any_of(s.rows.begin(), s.rows.end(), [](const Row &r) { return !std::isnan(r.x); });
    fprintf(f, "\n![%s](%s.png)\n", s.title.c_str(), s.id.c_str());
    (void)plotted;
    if (!s.verdicts.empty()) {
        fprintf(f, "\nTargets:\n\n");
        for (auto &v : s.verdicts) fprintf(f, "- %s\n", v.c_str());
    }
    fprintf(f, "\n");
    fclose(f);
}

inline std::string gp_quote(const std::string &s) {
    std::string q = "\"";
    for (char c : s) q += (c == '"' ? '\'' : c);
    return q + "\"";
}

// A line per (contender, series) against x when the rows have abscissae,
// otherwise grouped bars per row.
inline void write_plot(const Options &o, const Section &s) {
    FILE *d = open_out(o, s.id + ".dat");
    FILE *g = open_out(o, s.id + ".gp");
    fprintf(g, "set terminal pngcairo size 900,540 noenhanced font ',10'\nset output '%s.png'\n", s.id.c_str());
    fprintf(g, "set title %s\nset ylabel 'ns per operation (median)'\nset grid\nset key outside right\n",
            gp_quote(s.title).c_str());
    bool lines = std::any_of(s.rows.begin(), s.rows.end(), [](const Row &r) { return !std::isnan(r.x); });
    if (lines) {
        std::vector<std::string> series;
        for (auto &r : s.rows)
            if (!std::isnan(r.x) && std::find(series.begin(), series.end(), r.series) == series.end())
                series.push_back(r.series);
        // one gnuplot data block per (series, contender)
        int block = 0;
        std::string plot = "plot ";
        for (auto &se : series)
            for (size_t c = 0; c < s.columns.size(); ++c) {
                fprintf(d, "# %s %s\n", s.columns[c].name.c_str(), se.c_str());
                for (auto &r : s.rows)
                    if (!std::isnan(r.x) && r.series == se && !std::isnan(r.median[c]))
                        fprintf(d, "%g %g\n", r.x, r.median[c]);
                fprintf(d, "\n\n");
                std::string title = s.columns[c].name + (se.empty() ? "" : " " + se);
                const char *style = s.columns[c].role == Role::Ours ? "lw 3" : s.columns[c].role == Role::Floor ? "dt 2 lw 2" : "lw 1.5";
                plot += (block ? ", " : "") + std::string("'") + s.id + ".dat' index " + std::to_string(block) +
                        " with linespoints " + style + " title " + gp_quote(title);
                ++block;
            }
        fprintf(g, "set xlabel %s\n", gp_quote(s.xlabel).c_str());
        if (s.logx) fprintf(g, "set logscale x\n");
        fprintf(g, "set logscale y\n%s\n", plot.c_str());
    } else {
        fprintf(d, "row");
        for (auto &c : s.columns) fprintf(d, " %s", gp_quote(c.name).c_str());
        fprintf(d, "\n");
        for (auto &r : s.rows) {
            fprintf(d, "%s", gp_quote(r.label).c_str());
            for (double m : r.median) fprintf(d, " %g", std::isnan(m) ? 0.0 : m);
            fprintf(d, "\n");
        }
        fprintf(g, "set style data histograms\nset style histogram cluster gap 1\nset style fill solid 0.8 border -1\n"
                   "set xtics rotate by -20\nset yrange [0:*]\n");
        std::string plot = "plot ";
        for (size_t c = 0; c < s.columns.size(); ++c)
            plot += (c ? ", " : "") + std::string("'") + s.id + ".dat' using " + std::to_string(c + 2) +
                    (c ? "" : ":xtic(1)") + " title columnheader";
        fprintf(g, "%s\n", plot.c_str());
    }
    fclose(d);
    fclose(g);
}

inline void write(const Options &o, const Section &s) {
    write_markdown(o, s);
    write_plot(o, s);
    // echo the table on stdout for whoever runs the driver by hand
    printf("== %s\n", s.title.c_str());
    for (size_t r = 0; r < s.rows.size(); ++r) {
        printf("  %-18s", s.rows[r].label.c_str());
        for (size_t i = 0; i < s.columns.size(); ++i)
            printf(" %s=%s", s.columns[i].name.c_str(), fmt(s.rows[r].median[i]).c_str());
        printf("\n");
    }
    for (auto &v : s.verdicts) printf("  %s\n", v.c_str());
    fflush(stdout);
}

// Deterministic pseudo-random numbers (xorshift), the same for every
// contender.
struct Rng {
    unsigned long long s;
    explicit Rng(unsigned long long seed) : s(seed * 2654435761ULL + 1) {}
    unsigned long long next() {
        s ^= s << 13;
        s ^= s >> 7;
        s ^= s << 17;
        return s;
    }
    unsigned below(unsigned n) { return unsigned(next() % n); }
};

} // namespace bench
