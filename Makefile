# What people type; CMake presets do the work (CMakePresets.json).
JOBS ?= $(shell nproc)
RELEASE := build/release
BENCH := build/bench/bench
SIM_STEPS ?= 600e6
SIM_PLAIN_STEPS ?= 60e6
SIM_PREEMPTIONS ?= 3

.DEFAULT_GOAL := help
.PHONY: help run build test check sim mutants fuzz coverage format bench bench-build bench-full \
        counts clean

help: ## show this list
	@awk -F ':.*## ' '/^[a-z-]+:.*## /{printf "  make %-10s %s\n", $$1, $$2}' Makefile

run: build ## install what is needed, build, and watch a small cluster change
	examples/demo $(RELEASE)/karst examples/cluster.json

build: ## the module and the command: build/release/karst_resolver.so, build/release/karst
	tools/install-deps build
	cmake --preset release >/dev/null
	cmake --build --preset release -j $(JOBS)

test: ## install what is needed, build, and run every test
	tools/install-deps build test
	cmake --preset tests >/dev/null
	cmake --build --preset tests -j $(JOBS)
	ctest --test-dir $(RELEASE) --output-on-failure -j $(JOBS)

check: ## format, lint, lock discipline, the module's promises as an object, and the sanitizers
	tools/install-deps build test check
	tools/check

sim: ## search schedules and failures: SIM_STEPS (600e6) watched, then plain
	tools/install-deps build test
	cmake --preset tests >/dev/null
	cmake --build --preset tests -j $(JOBS) --target karst-sim karst_resolver karst_resolver_watched
	$(RELEASE)/karst-sim --watched --steps $(SIM_STEPS)
	$(RELEASE)/karst-sim --plain --steps $(SIM_PLAIN_STEPS)
	$(RELEASE)/karst-sim --plain --steps 1e9 --scenario small-destroy \
	  --strategy exhaustive:$(SIM_PREEMPTIONS)

mutants: ## plant faults one by one; each must be found
	tools/install-deps build test
	tools/mutants $(MUTANTS)

fuzz: ## throw bytes at every reader, FUZZ_SECONDS (60) each
	tools/install-deps build test fuzz
	cmake --preset fuzz >/dev/null
	cmake --build --preset fuzz -j $(JOBS)
	tools/fuzz

coverage: ## how much of the module the tests run, line by line: build/coverage/html
	tools/install-deps build test coverage
	tools/coverage

format: ## lay the sources out as .clang-format says
	tools/install-deps check
	git ls-files '*.h' '*.c' '*.cpp' | xargs clang-format -i

bench-build:
	tools/install-deps build bench
	cmake --preset bench >/dev/null
	cmake --build --preset bench -j $(JOBS)

bench: bench-build ## measure the hot paths beside their peers, and plot: build/bench/plots
	$(BENCH)/karst-bench --json=build/bench/bench.json
	tools/plot-bench --into=build/bench/plots --bench=build/bench/bench.json

bench-full: bench-build ## the same with more rounds, and how cost grows: docs/performance
	mkdir -p docs/performance
	$(BENCH)/karst-bench --json=docs/performance/bench.json --rounds=31
	$(BENCH)/karst-growth --json=docs/performance/growth.json
	tools/plot-bench --into=docs/performance --bench=docs/performance/bench.json \
	  --growth=docs/performance/growth.json

counts: ## count the instructions of the hot paths, and compare them with the recorded counts
	tools/install-deps build test counts
	tools/check-counts

clean: ## remove everything that was built
	rm -rf build
