# q7agent: developer and operator entry points.
#   make deps     install every missing Debian package (apt-get; sudo when not root)
#   make build    configure and build into build/ (RelWithDebInfo)
#   make test     deps + build + every test, then the unit tests again under ASan+UBSan and
#                 each fuzz target for FUZZ_SMOKE_SECONDS from its seeds
#   make demo     build, lay out a demo home in demo-home/ and run the agent in the foreground
#   make bench    Release build of the benchmarks, then run them
#   make install  lay out a home at PREFIX (default /opt/q7agent): bin/ lib/ config/ logs/ share/
#   make deb      Release build in build-deb/, then its Debian package (CPack)
#   make asan / make tsan   sanitizer builds with their unit tests (asan: clang, with the
#                           thread-safety analysis)
#   make test-tsan          the concurrency tests (runtime, situations, analyzer) under TSan
#   make fuzz     clang libFuzzer builds of the record parser, the HTTP parser, the capture
#                 pipeline, the configuration, properties and history files and the HTTP API's
#                 inputs, each run for FUZZ_SECONDS (default 60)
#   make fuzz-smoke         the same targets for FUZZ_SMOKE_SECONDS (default 10) each, from their
#                           seeds only; fails on any finding

SHELL := /bin/bash
BUILD_TYPE ?= RelWithDebInfo
PREFIX ?= /opt/q7agent
JOBS ?= $(shell nproc)
CMAKE_GEN := -G Ninja

DEPS := cmake ninja-build g++ make pkg-config git curl \
        libgtest-dev libgmock-dev libbenchmark-dev \
        libssl-dev zlib1g-dev libbrotli-dev libicu-dev icu-devtools \
        libcpp-httplib-dev nlohmann-json3-dev libspdlog-dev libfmt-dev \
        libcli11-dev libinih-dev clang libclang-rt-14-dev \
        libpcap-dev tshark tcpdump nginx-light pcapfix python3-dpkt goaccess prometheus tmux \
        dpkg-dev adduser libjs-chart.js chromium

SUDO := $(shell [ "$$(id -u)" = 0 ] || echo sudo)

.PHONY: all deps build test test-tsan demo bench load install deb asan tsan fuzz fuzz-build \
        fuzz-smoke fuzz-smoke-run soak \
        clean format

all: build

deps:
	@missing=""; \
	for p in $(DEPS); do \
	  dpkg-query -W -f='$${Status}\n' $$p 2>/dev/null | grep -q '^install ok installed' || missing="$$missing $$p"; \
	done; \
	if [ -n "$$missing" ]; then \
	  echo "Installing missing packages:$$missing"; \
	  $(SUDO) env DEBIAN_FRONTEND=noninteractive apt-get update -qq && \
	  $(SUDO) env DEBIAN_FRONTEND=noninteractive apt-get install -y -qq --no-install-recommends $$missing; \
	fi

# The benchmarks are built (in Release) and run by make bench, not here: make test has a time
# budget of its own. Debug information is line tables only (-g1, clang's -gline-tables-only):
# backtraces and sanitizer reports keep their files and lines, and compiling takes a quarter
# less than with full -g. `gdb` users who want variables: BUILD_TYPE=Debug, or their own -g.
LINE_TABLES := -DCMAKE_C_FLAGS_RELWITHDEBINFO="-O2 -g1 -DNDEBUG" \
               -DCMAKE_CXX_FLAGS_RELWITHDEBINFO="-O2 -g1 -DNDEBUG"
build/build.ninja:
	cmake -S . -B build $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=$(BUILD_TYPE) -DQ7_BUILD_BENCH=OFF \
	  $(LINE_TABLES)

build: deps build/build.ninja
	cmake --build build -j $(JOBS)

test: build
	cd build && ctest --output-on-failure -j $(JOBS) --timeout 300
	$(MAKE) --no-print-directory asan
	$(MAKE) --no-print-directory test-tsan

# The ASan+UBSan build is also the Clang thread-safety build (-Wthread-safety with -Werror). A
# cache configured with another compiler is dropped first: CMake cannot switch it in place.
asan: deps
	@if [ -f build-asan/CMakeCache.txt ] && \
	    ! grep -q '^CMAKE_CXX_COMPILER:[A-Z]*=\(.*/\)\?clang++$$' build-asan/CMakeCache.txt; then \
	  echo "build-asan was configured with another compiler: configuring it afresh"; \
	  rm -rf build-asan/CMakeCache.txt build-asan/CMakeFiles; \
	fi
	cmake -S . -B build-asan $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Debug -DQ7_SANITIZE=ON -DQ7_FUZZ=ON \
	  -DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++ -DQ7_BUILD_E2E=OFF -DQ7_BUILD_BENCH=OFF \
	  -DCMAKE_C_FLAGS_DEBUG=-gline-tables-only -DCMAKE_CXX_FLAGS_DEBUG=-gline-tables-only
	cmake --build build-asan -j $(JOBS) --target unit_tests $(FUZZ_TARGETS)
	cd build-asan && ctest --output-on-failure -j $(JOBS) -L unit --timeout 300
	$(MAKE) --no-print-directory -j $(JOBS) -O fuzz-smoke-run FUZZ_DIR=build-asan

tsan: deps
	cmake -S . -B build-tsan $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Debug -DQ7_TSAN=ON \
	  -DQ7_BUILD_E2E=OFF -DQ7_BUILD_BENCH=OFF -DCMAKE_C_FLAGS_DEBUG=-g1 -DCMAKE_CXX_FLAGS_DEBUG=-g1
	cmake --build build-tsan -j $(JOBS)
	cd build-tsan && ctest --output-on-failure -j $(JOBS) -L unit --timeout 300

# The concurrency code under ThreadSanitizer (part of make test): the runtime primitives, the
# situation controller shared by framework threads and the analyzer, the analyzer thread, the
# intake threads (data file monitors and the file manager), the checkpoint writer, the
# framework's event rings, event streams, situations and condition waits, and the collector
# process monitors.
test-tsan: deps
	cmake -S . -B build-tsan $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Debug -DQ7_TSAN=ON \
	  -DQ7_BUILD_E2E=OFF -DQ7_BUILD_BENCH=OFF -DCMAKE_C_FLAGS_DEBUG=-g1 -DCMAKE_CXX_FLAGS_DEBUG=-g1
	cmake --build build-tsan -j $(JOBS) --target runtime_test analyzer_test framework_test tama_test \
	  history_test
	build-tsan/bin/runtime_test --gtest_brief=1
	build-tsan/bin/tama_test --gtest_brief=1 --gtest_filter='ServiceMonitor*'
	build-tsan/bin/framework_test --gtest_brief=1 --gtest_filter='Events*:Situations*:CondVar*:Alert*:Webhook*'
	build-tsan/bin/analyzer_test --gtest_brief=1 --gtest_filter='Situation*:Processing*:WaitFor*:DataFileMonitor*:FileManager*:Checkpoint*'
	build-tsan/bin/history_test --gtest_brief=1 --gtest_filter='CheckpointWriter*'

bench: deps
	cmake -S . -B build-release $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Release -DQ7_BUILD_TESTS=OFF
	cmake --build build-release -j $(JOBS)
	@for b in build-release/bin/bench_*; do [ -x "$$b" ] && "$$b"; done; true
	bench/q7bench_series.sh build-release/bin/bench_q7bench 5

# The kill loop at length: the agent killed SOAK_KILLS times (runs of up to SOAK_MAX_MS each)
# while the simulated collector writes 2,000 records a second; make test runs 10 kills.
SOAK_KILLS ?= 200
SOAK_MAX_MS ?= 8000
soak: build
	Q7_KILLS=$(SOAK_KILLS) Q7_KILL_MAX_MS=$(SOAK_MAX_MS) build/bin/crash_e2e_test

# The agent under load (Release): LOAD_RATE records a second ingested for LOAD_SECONDS while 20
# clients sample its tables and events; exits non-zero when a request fails, ingestion stalls
# for over a second or memory grows after the first minute. LOAD_ALERT_EVERY=N adds five
# alerting situations sampled every N seconds whose webhook never answers.
LOAD_RATE ?= 200000
LOAD_SECONDS ?= 120
LOAD_ALERT_EVERY ?= 0
load: deps
	cmake -S . -B build-release $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Release -DQ7_BUILD_TESTS=OFF
	cmake --build build-release -j $(JOBS) --target q7load
	build-release/bin/q7load --rate $(LOAD_RATE) --seconds $(LOAD_SECONDS) --alert-every $(LOAD_ALERT_EVERY)

FUZZ_SECONDS ?= 60
FUZZ_SMOKE_SECONDS ?= 10
FUZZ_TARGETS := sm3_fuzz http_parser_fuzz capture_fuzz config_fuzz properties_fuzz api_fuzz \
                history_fuzz checkpoint_fuzz
# Each target's corpus (under build-fuzz/), seeds (under tests/fuzz/) and options; by default
# corpus_<target> and seeds_<target>.
FUZZ_CORPUS_sm3_fuzz := corpus
FUZZ_SEEDS_sm3_fuzz := seeds
FUZZ_OPTS_sm3_fuzz := -max_len=40000 -dict=$(CURDIR)/tests/fuzz/sm3.dict
FUZZ_OPTS_http_parser_fuzz := -max_len=8192 -dict=$(CURDIR)/tests/fuzz/http.dict
FUZZ_OPTS_capture_fuzz := -max_len=16384 -dict=$(CURDIR)/tests/fuzz/http.dict
FUZZ_OPTS_config_fuzz := -max_len=4096 -dict=$(CURDIR)/tests/fuzz/config.dict
FUZZ_OPTS_properties_fuzz := -max_len=8192 -dict=$(CURDIR)/tests/fuzz/properties.dict
FUZZ_OPTS_api_fuzz := -max_len=2048 -dict=$(CURDIR)/tests/fuzz/api.dict
FUZZ_OPTS_history_fuzz := -max_len=16384
FUZZ_OPTS_checkpoint_fuzz := -max_len=16384
fuzz_corpus = build-fuzz/$(or $(FUZZ_CORPUS_$(1)),corpus_$(1))
fuzz_seeds = $(CURDIR)/tests/fuzz/$(or $(FUZZ_SEEDS_$(1)),seeds_$(1))
# UBSan reports stop the run, so that they count as findings.
FUZZ_ENV := UBSAN_OPTIONS=halt_on_error=1:print_stacktrace=1
define newline


endef

fuzz-build: deps
	cmake -S . -B build-fuzz $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=RelWithDebInfo \
	  -DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++ -DQ7_FUZZ=ON -DQ7_BUILD_TESTS=OFF
	cmake --build build-fuzz -j $(JOBS) --target $(FUZZ_TARGETS)

# Each target on its corpus, which keeps what it finds, and its seeds.
fuzz: fuzz-build
	$(foreach t,$(FUZZ_TARGETS),mkdir -p $(call fuzz_corpus,$(t))$(newline)\
	cd build-fuzz && $(FUZZ_ENV) bin/$(t) -max_total_time=$(FUZZ_SECONDS) -print_final_stats=1 \
	  $(FUZZ_OPTS_$(t)) $(CURDIR)/$(call fuzz_corpus,$(t)) $(call fuzz_seeds,$(t))$(newline))

# Each target briefly from its seeds alone (new inputs go to a scratch corpus); any crash, leak,
# hang or UBSan report fails. FUZZ_DIR is the build holding the targets: make asan runs the
# same from build-asan, whose libraries carry the fuzzer's coverage too. Targets run JOBS at a
# time, each one's output kept together.
FUZZ_DIR ?= build-fuzz
fuzz-smoke: fuzz-build
	$(MAKE) --no-print-directory -j $(JOBS) -O fuzz-smoke-run
fuzz-smoke-run: $(addprefix fuzz-smoke-,$(FUZZ_TARGETS))
fuzz-smoke-%:
	rm -rf $(FUZZ_DIR)/smoke_$* && mkdir -p $(FUZZ_DIR)/smoke_$*
	cd $(FUZZ_DIR) && $(FUZZ_ENV) bin/$* -max_total_time=$(FUZZ_SMOKE_SECONDS) -timeout=20 \
	  -print_final_stats=1 $(FUZZ_OPTS_$*) smoke_$* $(call fuzz_seeds,$*)

install: build
	cmake --install build --prefix "$(PREFIX)"
	PREFIX="$(PREFIX)" resources/install-home.sh
	@echo "Live capture (sm3ctl.conf MODE=capture) needs CAP_NET_RAW: run the agent as root, or give"
	@echo "sm3capture the capability once: setcap cap_net_raw,cap_net_admin=eip $(PREFIX)/bin/sm3capture"

# The package's programs come from a build of their own, without tests or benchmarks; cpack
# prints its progress, the last line names the package.
deb: deps
	cmake -S . -B build-deb $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Release -DQ7_BUILD_TESTS=OFF \
	  -DQ7_BUILD_BENCH=OFF
	cmake --build build-deb -j $(JOBS)
	rm -f build-deb/q7agent_*.deb
	cd build-deb && cpack -G DEB
	@echo "Debian package: $$(ls $(CURDIR)/build-deb/q7agent_*.deb)"

DEMO_HOME ?= $(CURDIR)/demo-home
demo: build
	@resources/demo.sh --check "$(DEMO_HOME)"
	@$(MAKE) --no-print-directory install PREFIX="$(DEMO_HOME)" >/dev/null
	@echo "q7agent demo: dashboard on http://127.0.0.1:7420/ (home $(DEMO_HOME)/; Ctrl-C stops it)"
	@resources/demo.sh "$(DEMO_HOME)"

format:
	clang-format -i $$(git ls-files '*.h' '*.cc')

clean:
	rm -rf build build-asan build-tsan build-release build-fuzz build-deb
