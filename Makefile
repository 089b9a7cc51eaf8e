# What people type; CMake presets do the work (CMakePresets.json).
JOBS ?= $(shell nproc)
RELEASE := build/release

.DEFAULT_GOAL := help
.PHONY: help run build test check format bench clean

help: ## show this list
	@awk -F ':.*## ' '/^[a-z]+:.*## /{printf "  make %-8s %s\n", $$1, $$2}' Makefile

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

format: ## lay the sources out as .clang-format says
	tools/install-deps check
	git ls-files '*.h' '*.c' '*.cpp' | xargs clang-format -i

bench: ## measure the hot paths beside their peers
	tools/install-deps build bench
	cmake --preset bench >/dev/null
	cmake --build --preset bench -j $(JOBS)
	build/bench/bench/karst-bench

clean: ## remove everything that was built
	rm -rf build
