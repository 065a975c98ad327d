# The two commands that matter: `make run` and `make test`. Both install any
# missing Debian packages first, then configure and build in Release mode.
BUILD_DIR ?= build
ASAN_BUILD_DIR ?= build-asan
FUZZ_BUILD_DIR ?= build-fuzz
FUZZ_SECONDS ?= 60
FUZZ_TARGETS := $(basename $(notdir $(wildcard fuzz/fuzz_*.cpp)))
JOBS ?= $(shell nproc)
CMAKE_FLAGS ?=

.PHONY: all deps build run test test-asan fuzz bench bench-remote package check-install install format format-check clean

all: build

deps:
	@bash scripts/install-deps.sh

$(BUILD_DIR)/CMakeCache.txt: | deps
	cmake -S . -B $(BUILD_DIR) -DCMAKE_BUILD_TYPE=Release $(CMAKE_FLAGS)

build: deps $(BUILD_DIR)/CMakeCache.txt
	cmake --build $(BUILD_DIR) --parallel $(JOBS)

run: build
	./$(BUILD_DIR)/gwarchive --version
	@bash scripts/run-samples.sh $(BUILD_DIR)

test: build
	cd $(BUILD_DIR) && ctest --output-on-failure --parallel $(JOBS)

# The whole suite under AddressSanitizer and UndefinedBehaviorSanitizer.
test-asan: deps
	cmake -S . -B $(ASAN_BUILD_DIR) -DCMAKE_BUILD_TYPE=RelWithDebInfo -DGW_SANITIZE=ON $(CMAKE_FLAGS)
	cmake --build $(ASAN_BUILD_DIR) --parallel $(JOBS)
	cd $(ASAN_BUILD_DIR) && ASAN_OPTIONS=detect_leaks=1 UBSAN_OPTIONS=print_stacktrace=1 \
		ctest --output-on-failure --parallel $(JOBS)

# Every fuzz target for FUZZ_SECONDS on its seed corpus (clang 14, libFuzzer,
# AddressSanitizer and UndefinedBehaviorSanitizer); a finding fails the run
# and shows the end of that target's log.
fuzz: deps
	CC=clang-14 CXX=clang++-14 cmake -S . -B $(FUZZ_BUILD_DIR) -DCMAKE_BUILD_TYPE=RelWithDebInfo \
		-DGW_FUZZ=ON $(CMAKE_FLAGS)
	cmake --build $(FUZZ_BUILD_DIR) --parallel $(JOBS) --target fuzz_all
	@mkdir -p $(FUZZ_BUILD_DIR)/fuzz/logs
	@for target in $(FUZZ_TARGETS); do \
		log=$(FUZZ_BUILD_DIR)/fuzz/logs/$$target.log; \
		if FUZZ_BUILD_DIR=$(FUZZ_BUILD_DIR) bash scripts/fuzz.sh $$target $(FUZZ_SECONDS) >$$log 2>&1; then \
			echo "$$target: $$(grep -E '^#[0-9]+[[:space:]]+DONE' $$log | tail -1)"; \
		else \
			tail -n 60 $$log; echo "$$target: FAILED (see $$log)"; exit 1; \
		fi; \
	done

# gwarchive against unzip, bsdtar, 7zz and unar on a generated corpus (kept
# in $(BUILD_DIR)/bench-corpus), with the remote rows of bench/remote.sh
# when run as root; writes bench/RESULTS.md.
bench: build
	python3 bench/run.py --build $(BUILD_DIR)

# Extraction and listing over HTTP behind 20 ms, beside the local file (root).
bench-remote: build
	bench/remote.sh $(BUILD_DIR)

# A .deb of the library, its headers, the tool and its manual, in $(BUILD_DIR).
package: build
	cd $(BUILD_DIR) && cpack -G DEB

install: build
	cmake --install $(BUILD_DIR)

# Installs into a temporary prefix and builds examples/ from there both ways.
check-install: build
	bash scripts/check-install.sh $(BUILD_DIR)

format:
	git ls-files '*.h' '*.cpp' | xargs clang-format -i

format-check:
	git ls-files '*.h' '*.cpp' | xargs clang-format --dry-run --Werror

clean:
	rm -rf $(BUILD_DIR) $(ASAN_BUILD_DIR) $(FUZZ_BUILD_DIR)
