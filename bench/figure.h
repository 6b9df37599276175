// What a benchmark found, for people and for scripts. Not installed.
#ifndef BENCH_FIGURE_H_
#define BENCH_FIGURE_H_

#include <cmath>
#include <cstdio>
#include <string>
#include <vector>

namespace bench {

// NAN stands for what does not apply.
struct Figure {
  std::string name;
  std::string unit;
  double value = NAN;
  double baseline = NAN;  // In the same unit: what `value` is compared with.
  double aim = NAN;       // The most that the ratio to the baseline may be; `value` where none is.

  double Ratio() const { return value / baseline; }
  double Judged() const { return std::isnan(baseline) ? value : Ratio(); }
  bool HasAim() const { return !std::isnan(aim) && !std::isnan(Judged()); }
  bool Met() const { return Judged() <= aim; }
};

// The number, or `missing`.
inline std::string Text(const char* format, double number, const char* missing) {
  char text[64];
  (void)snprintf(text, sizeof(text), format, number);
  return std::isnan(number) ? missing : text;
}

// A JSON object a line: {"case":...,"value":...,"unit":...,"baseline":...,"ratio":...,"aim":...,
// "met":...} with null for what does not apply.
inline void PrintJson(const std::vector<Figure>& figures) {
  for (const Figure& figure : figures) {
    std::printf(R"({"case":"%s","value":%s,"unit":"%s","baseline":%s,"ratio":%s,"aim":%s,"met":%s})"
                "\n",
                figure.name.c_str(), Text("%.6g", figure.value, "null").c_str(),
                figure.unit.c_str(), Text("%.6g", figure.baseline, "null").c_str(),
                Text("%.6g", figure.Ratio(), "null").c_str(),
                Text("%.6g", figure.aim, "null").c_str(),
                !figure.HasAim() ? "null"
                : figure.Met()   ? "true"
                                 : "false");
  }
}

inline void PrintTable(const std::vector<Figure>& figures) {
  std::printf("%-34s %12s %-12s %12s %9s %7s  %s\n", "case", "value", "unit", "baseline", "ratio",
              "aim", "met");
  for (const Figure& figure : figures) {
    std::printf("%-34s %12s %-12s %12s %9s %7s  %s\n", figure.name.c_str(),
                Text("%.6g", figure.value, "").c_str(), figure.unit.c_str(),
                Text("%.6g", figure.baseline, "").c_str(), Text("%.4g", figure.Ratio(), "").c_str(),
                Text("%g", figure.aim, "").c_str(),
                !figure.HasAim() ? "-"
                : figure.Met()   ? "yes"
                                 : "no");
  }
}

inline void Print(const std::vector<Figure>& figures, bool json) {
  json ? PrintJson(figures) : PrintTable(figures);
}

}  // namespace bench

#endif  // BENCH_FIGURE_H_
