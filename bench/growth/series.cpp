/* Rounds, medians, tables; see series.h. */
#include "bench/growth/series.h"

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <nlohmann/json.hpp>
#include <thread>

namespace growth {
namespace {

Figure figureOf(std::vector<double> values) {
  std::sort(values.begin(), values.end());
  const size_t size = values.size();
  return {values[size / 2], (values[size * 3 / 4] - values[size / 4]) / 2};
}

std::string processor() {
  std::ifstream info("/proc/cpuinfo");
  for (std::string line; std::getline(info, line);) {
    if (line.rfind("model name", 0) != 0) continue;
    return line.substr(line.find(':') + 2);
  }
  return "an unknown processor";
}

/* No more digits than there is reason for: 8.41, 84.1, 841, 8410. */
std::string shown(double value) {
  if (std::isnan(value)) return "-";
  char text[32];
  const double size = std::abs(value);
  const int digits = size == 0 || size >= 100 ? 0 : size >= 10 ? 1 : 2;
  std::snprintf(text, sizeof text, "%.*f", digits, value);
  return text;
}

/* What is kept in files has no digits that say nothing. */
double rounded(double value) {
  char text[32];
  std::snprintf(text, sizeof text, "%.5g", value);
  return std::strtod(text, nullptr);
}

}  // namespace

bool Series::kept() const {
  return std::all_of(promises.begin(), promises.end(), [](const Promise &one) { return one.kept; });
}

void sample(Series &series, const std::vector<double> &ats, unsigned rounds,
            const Sample &sampled) {
  const size_t columns = series.columns.size();
  std::vector<std::vector<std::vector<double>>> values(ats.size());
  for (auto &ofPoint : values) ofPoint.resize(columns);
  for (unsigned round = 1; round <= rounds; round++) {
    std::fprintf(stderr, "\r%s: round %u of %u ", series.name.c_str(), round, rounds);
    for (size_t i = 0; i < ats.size(); i++) {
      const std::vector<double> one = sampled(ats[i]);
      for (size_t column = 0; column < columns; column++) {
        values[i][column].push_back(one.at(column));
      }
    }
  }
  std::fprintf(stderr, "\n");
  for (size_t i = 0; i < ats.size(); i++) {
    Point point{ats[i], {}};
    for (const auto &ofColumn : values[i]) {
      const bool any = !std::isnan(ofColumn.front());
      point.figures.push_back(any ? figureOf(ofColumn) : Figure{NAN, NAN});
    }
    series.points.push_back(std::move(point));
  }
}

double medianOf(unsigned turns, const std::function<double()> &once) {
  once();
  std::vector<double> values(turns);
  for (double &value : values) value = once();
  return figureOf(std::move(values)).median;
}

void print(const Series &series) {
  std::printf("\n%s\n%12s", series.name.c_str(), series.axis.c_str());
  for (const Column &column : series.columns) {
    const std::string head = column.name + (column.unit.empty() ? "" : ", " + column.unit);
    std::printf("  %24s", head.c_str());
  }
  std::printf("\n");
  for (const Point &point : series.points) {
    std::printf("%12s", std::isinf(point.at) ? "flat out" : shown(point.at).c_str());
    for (const Figure &figure : point.figures) {
      if (std::isnan(figure.median)) {
        std::printf("  %24s", "-");
      } else {
        std::printf("  %13s +- %7s", shown(figure.median).c_str(), shown(figure.spread).c_str());
      }
    }
    std::printf("\n");
  }
  for (const Promise &promise : series.promises) {
    std::printf("%12s  %s\n", promise.kept ? "kept" : "BROKEN", promise.text.c_str());
  }
}

nlohmann::ordered_json json(const std::vector<Series> &all) {
  nlohmann::ordered_json out;
  out["machine"] = {{"processor", processor()},
                    {"processors", std::thread::hardware_concurrency()}};
  for (const Series &series : all) {
    nlohmann::ordered_json one{{"name", series.name}, {"axis", series.axis}};
    for (const Column &column : series.columns) {
      one["columns"].push_back({{"name", column.name}, {"unit", column.unit}});
    }
    for (const Point &point : series.points) {
      nlohmann::ordered_json figures;
      for (const Figure &figure : point.figures) {
        figures.push_back({{"median", rounded(figure.median)}, {"spread", rounded(figure.spread)}});
      }
      one["points"].push_back({{"at", point.at}, {"figures", figures}}); /* infinite: null */
    }
    for (const Promise &promise : series.promises) {
      one["promises"].push_back({{"text", promise.text}, {"kept", promise.kept}});
    }
    out["series"].push_back(std::move(one));
  }
  return out;
}

}  // namespace growth
