/* How figures grow along an axis: points, each with the median and the spread of every column over
 * the rounds; and promises that were looked at on the way. Printed as text and written as JSON. */
#pragma once

#include <cmath>
#include <functional>
#include <nlohmann/json_fwd.hpp>
#include <string>
#include <vector>

namespace growth {

struct Column {
  std::string name, unit; /* times are in ns, rates in 1/s */
};

struct Figure {
  double median;
  double spread; /* half the distance between the quartiles, in the unit of the column */
};

struct Point {
  double at; /* infinite: without a limit */
  std::vector<Figure> figures;
};

struct Promise {
  std::string text;
  bool kept;
};

struct Series {
  std::string name, axis;
  std::vector<Column> columns;
  std::vector<Point> points;
  std::vector<Promise> promises = {};
  bool kept() const;
};

/* One value a column; NAN where a point has none. */
using Sample = std::function<std::vector<double>(double at)>;

/* Samples every point once a round, so that what disturbs the machine for a while disturbs all
 * points and moves the median of none. Says on stderr how far it is. */
void sample(Series &series, const std::vector<double> &ats, unsigned rounds, const Sample &sampled);

/* The median of what `once` returns in so many turns; the first one, which warms up, does not
 * count. */
double medianOf(unsigned turns, const std::function<double()> &once);

void print(const Series &series);
nlohmann::ordered_json json(const std::vector<Series> &all);

/* The axes. Each makes a kernel of its own; a process has one at a time. */
Series growNodes();
Series growInterfaces();
Series growInstances();
Series growEvents();
Series growReaders();

}  // namespace growth
