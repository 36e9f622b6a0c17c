// Side-by-side comparison harness: runs every contender of a figure in the
// same process, interleaved (the order rotates from one repetition to the
// next), repeats each figure and keeps the median. Each driver fills
// Sections and writes each as a Markdown table, gnuplot data and the plot's
// settings; scripts/bench.sh draws them with bench/figure.gp and stitches the
// tables, under the prose of bench/text/<id>.md, into BENCHMARKS.md.
#pragma once

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <getopt.h>
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
template <class T>
inline void keep(T const &value) {
    asm volatile("" : : "r,m"(value) : "memory");
}

// Command-line knobs shared by every driver.
struct Options {
    int reps = 7;              // repetitions per figure (median of these)
    double sample_ms = 20;     // target duration of one timed sample
    double scale = 1.0;        // <1 for a quick smoke run
    std::string out_dir = "."; // where fragments, data and plot scripts go
    std::string only;          // run only contenders whose name contains this (profiling)

    static Options parse(int argc, char **argv) {
        static const option knobs[] = {{"reps", 1, nullptr, 'r'},
                                       {"sample-ms", 1, nullptr, 'm'},
                                       {"scale", 1, nullptr, 's'},
                                       {"out", 1, nullptr, 'o'},
                                       {"clock", 1, nullptr, 'c'},
                                       {"only", 1, nullptr, 'n'},
                                       {}};
        Options o;
        for (int c; (c = getopt_long(argc, argv, "", knobs, nullptr)) != -1 || optind < argc;) switch (c) {
            case 'r': o.reps = std::max(1, atoi(optarg)); break;
            case 'm': o.sample_ms = atof(optarg); break;
            case 's': o.scale = atof(optarg); break;
            case 'o': o.out_dir = optarg; break;
            case 'c':
                sample_clock() = strcmp(optarg, "wall") == 0 ? CLOCK_MONOTONIC : CLOCK_THREAD_CPUTIME_ID;
                break;
            case 'n': o.only = optarg; break;
            default:
                fprintf(stderr,
                        "usage: %s [--reps=N] [--sample-ms=MS] [--scale=F] [--out=DIR] [--clock=cpu|wall] "
                        "[--only=NAME]\n",
                        argv[0]);
                exit(2);
            }
        return o;
    }
};

enum class Role { Ours, Peer, Floor };

// One contender of a figure: run() performs one timed sample and returns the
// cost of one operation in nanoseconds.
struct Contender {
    std::string name;
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
inline std::vector<double> interleave(const Options &o, std::vector<Contender> &cs) {
    std::vector<std::vector<double>> samples(cs.size());
    for (int r = 0; r < o.reps; ++r)
        for (size_t k = 0; k < cs.size(); ++k) {
            size_t i = (k + size_t(r)) % cs.size();
            if (!o.only.empty() && cs[i].name.find(o.only) == std::string::npos) continue;
            samples[i].push_back(cs[i].run());
        }
    std::vector<double> med;
    for (auto &s : samples) med.push_back(median(s));
    return med;
}

// Calibrates an operation count once (so that one sample lasts about
// sample_ms), then returns the cost of one operation per sample.
// sample(n) performs n operations and returns the nanoseconds they took.
class Calibrated {
  public:
    Calibrated(const Options &o, std::function<double(long)> sample, long min_ops = 16)
        : opt_(o), sample_(std::move(sample)), min_ops_(min_ops) {}
    double operator()() {
        if (ops_ == 0) calibrate();
        return sample_(ops_) / double(ops_);
    }

  private:
    void calibrate() {
        double want = opt_.sample_ms * 1e6 * opt_.scale;
        for (long n = min_ops_;; n *= 4) {
            double dt = sample_(n);
            if (dt > want / 4 || n > (1L << 40)) {
                ops_ = std::max(min_ops_, long(double(n) * want / dt));
                return;
            }
        }
    }
    const Options &opt_;
    std::function<double(long)> sample_;
    long min_ops_;
    long ops_ = 0;
};

// The same, timing body(n) on the sample clock.
inline Calibrated timed(const Options &o, std::function<void(long)> body) {
    return Calibrated(o, [body](long n) {
        double t0 = now_ns();
        body(n);
        return now_ns() - t0;
    });
}

struct Column {
    std::string name;
    Role role;
};
inline Column ours(const char *name) { return {name, Role::Ours}; }
inline Column peer(const char *name) { return {name, Role::Peer}; }
inline Column floor_of(const char *name) { return {name, Role::Floor}; }

struct Row {
    std::string label;  // first column of the table
    double x = NAN;     // abscissa of the plot; NaN rows are left out of it
    std::string series; // rows of one series form one line per contender
    std::vector<double> median;
};

// One table (and one plot) of BENCHMARKS.md.
struct Section {
    std::string id;       // file stem: <id>.md, <id>.dat, <id>.vars, <id>.png
    std::string row_head; // heading of the label column
    std::string xlabel;
    bool logx = false;
    std::vector<Column> columns;
    std::vector<Row> rows;
    std::vector<std::string> verdicts; // target lines, filled by the driver

    Section(std::string id_, std::string row_head_, std::string xlabel_, bool logx_,
            std::vector<Column> columns_ = {})
        : id(std::move(id_)), row_head(std::move(row_head_)), xlabel(std::move(xlabel_)), logx(logx_),
          columns(std::move(columns_)) {}

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
    snprintf(b, sizeof b, ns >= 100000 ? "%.0f" : ns >= 100 ? "%.1f" : "%.2f", ns);
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

// Ends a driver whose set-up failed: its figures would mean nothing.
inline void require(bool ok, const char *what) {
    if (ok) return;
    perror(what);
    exit(1);
}

inline FILE *open_out(const Options &o, const std::string &name) {
    std::string path = o.out_dir + "/" + name;
    FILE *f = fopen(path.c_str(), "w");
    require(f != nullptr, path.c_str());
    return f;
}

inline void write_markdown(const Options &o, const Section &s, FILE *f) {
    fprintf(f,
            "Median ns per operation over %d interleaved repetitions; in brackets the ratio to the best "
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
            fprintf(f, " %s%s (%s)%s |", ours ? "**" : "", fmt(m).c_str(), ratio(m / best).c_str(),
                    ours ? "**" : "");
        }
        fprintf(f, " %s |\n", who.empty() ? "-" : who.c_str());
    }
    if (!s.verdicts.empty()) {
        fprintf(f, "\nTargets:\n\n");
        for (auto &v : s.verdicts) fprintf(f, "- %s\n", v.c_str());
    }
}

inline std::string gp_quote(const std::string &s) {
    std::string q = "\"";
    for (char c : s) q += (c == '"' ? '\'' : c);
    return q + "\"";
}

// The plot's data for bench/figure.gp: with abscissae, one block per
// (series, contender) headed by its title, drawn as lines; without, one row
// per table row, drawn as grouped bars. <id>.vars holds the plot's settings.
inline void write_plot(const Options &o, const Section &s) {
    FILE *d = open_out(o, s.id + ".dat");
    bool lines = std::any_of(s.rows.begin(), s.rows.end(), [](const Row &r) { return !std::isnan(r.x); });
    std::string widths, dashes;
    int blocks = 0;
    if (lines) {
        std::vector<std::string> series;
        for (auto &r : s.rows)
            if (!std::isnan(r.x) && std::find(series.begin(), series.end(), r.series) == series.end())
                series.push_back(r.series);
        for (auto &se : series)
            for (size_t c = 0; c < s.columns.size(); ++c, ++blocks) {
                fprintf(d, "x %s\n", gp_quote(s.columns[c].name + (se.empty() ? "" : " " + se)).c_str());
                for (auto &r : s.rows)
                    if (!std::isnan(r.x) && r.series == se && !std::isnan(r.median[c]))
                        fprintf(d, "%g %g\n", r.x, r.median[c]);
                fprintf(d, "\n\n");
                Role role = s.columns[c].role;
                widths += role == Role::Ours ? "3 " : role == Role::Floor ? "2 " : "1.5 ";
                dashes += role == Role::Floor ? "2 " : "1 ";
            }
    } else {
        fprintf(d, "row");
        for (auto &c : s.columns) fprintf(d, " %s", gp_quote(c.name).c_str());
        fprintf(d, "\n");
        for (auto &r : s.rows) {
            fprintf(d, "%s", gp_quote(r.label).c_str());
            for (double m : r.median) fprintf(d, " %g", std::isnan(m) ? 0.0 : m);
            fprintf(d, "\n");
        }
    }
    fclose(d);
    FILE *v = open_out(o, s.id + ".vars");
    fprintf(v, "lines = %d; blocks = %d; columns = %zu; logx = %d\nxlabel = %s; widths = %s; dashes = %s\n",
            lines, blocks, s.columns.size(), s.logx, gp_quote(s.xlabel).c_str(), gp_quote(widths).c_str(),
            gp_quote(dashes).c_str());
    fclose(v);
}

inline void write(const Options &o, const Section &s) {
    FILE *f = open_out(o, s.id + ".md");
    write_markdown(o, s, f);
    fclose(f);
    write_plot(o, s);
    write_markdown(o, s, stdout); // for whoever runs the driver by hand
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
