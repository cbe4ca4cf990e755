# Two commands matter: `make run` and `make test`. Both install what is missing first.
BUILD      ?= build
ASAN_BUILD ?= build-asan
JOBS       ?= $(shell nproc)
DEB_PACKAGES = cmake g++ make pkg-config libasio-dev libmsgpack-cxx-dev nlohmann-json3-dev \
               libsqlite3-dev sqlite3 systemtap-sdt-dev libgtest-dev libgmock-dev googletest \
               libcurl4-openssl-dev python3-msgpack help2man dpkg-dev libjemalloc-dev ccache \
               libsystemd-dev zlib1g-dev protobuf-compiler libprotobuf-dev systemd libcli11-dev
# Paths below the checkout are hashed relative to it, so any clone shares ccache's results.
export CCACHE_BASEDIR := $(CURDIR)
# The libraries precompile their common headers; ccache caches around them only when told to.
export CCACHE_SLOPPINESS := pch_defines,time_macros,include_file_mtime,include_file_ctime

.PHONY: deps build run test test-asan clean format install package fuzz

deps:
	@missing=$$(for p in $(DEB_PACKAGES); do dpkg-query -W -f='$${Status}\n' $$p 2>/dev/null | grep -q '^install ok installed' || echo $$p; done); \
	if [ -n "$$missing" ]; then \
	  echo "installing:$$missing"; \
	  SUDO=$$( [ "$$(id -u)" = 0 ] || echo sudo ); \
	  $$SUDO apt-get update -qq && DEBIAN_FRONTEND=noninteractive $$SUDO apt-get install -y -qq $$missing; \
	fi

$(BUILD)/CMakeCache.txt:
	cmake -S . -B $(BUILD) -DCMAKE_BUILD_TYPE=RelWithDebInfo

build: deps $(BUILD)/CMakeCache.txt
	cmake --build $(BUILD) -j $(JOBS)

# Everything under ./var, for root too; var/env.sh lets sxreportctl in another shell find it.
VAR := $(CURDIR)/var
RUN_ENV = SXREPORTING_STATE_DIR=$(VAR)/lib SXREPORTING_CONFIG_DIR=$(VAR)/etc \
          SXREPORTING_RUNTIME_DIR=$(VAR)/run SXREPORTING_KESTREL_ROOT=$(VAR)/kestrel \
          SXREPORTING_DIAGNOSTIC_LOGS_DIR=$(VAR)/log/DiagnosticLogs/Audio/Reporting

run: build
	@mkdir -p $(VAR)
	@for v in $(RUN_ENV); do echo "export $$v"; done > $(VAR)/env.sh
	@echo "sxreportingd: state, configuration and socket under $(VAR)"
	@echo "In another shell:  . var/env.sh && $(BUILD)/sxreportctl status"
	@echo "                   $(BUILD)/sxreportctl create 42 then set-type telephony 42 then valid 42"
	$(RUN_ENV) $(BUILD)/sxreportingd $(ARGS)

# lintian checks the packages in the install.packages test, which skips it when it is missing.
test: DEB_PACKAGES += lintian
test: build
	cd $(BUILD) && ctest --output-on-failure -j $(JOBS)

# The sanitizer build is clang's: it compiles the suite in about 60 % of g++'s time, and the
# libFuzzer targets (clang only) come from the same tree, so `make fuzz` adds three files to it.
$(ASAN_BUILD)/CMakeCache.txt:
	CC=clang CXX=clang++ cmake -S . -B $(ASAN_BUILD) -DCMAKE_BUILD_TYPE=Debug -DSXR_SANITIZE=ON \
	  -DSXR_FUZZ=ON

test-asan: DEB_PACKAGES += clang libclang-rt-dev
test-asan: deps $(ASAN_BUILD)/CMakeCache.txt
	cmake --build $(ASAN_BUILD) -j $(JOBS)
	cd $(ASAN_BUILD) && ASAN_OPTIONS=detect_leaks=1 UBSAN_OPTIONS=print_stacktrace=1 ctest --output-on-failure -j $(JOBS)

# Installs under $(PREFIX) (or $(DESTDIR)$(PREFIX)); see README "Install as a service".
PREFIX ?= /usr/local
install: build
	DESTDIR=$(DESTDIR) cmake --install $(BUILD) --prefix $(PREFIX)

# The Debian packages, $(BUILD)/<package>_<version>_<arch>.deb: sxreportingd, libsxreporting0,
# libsxreporting-dev and sxreporting-bench (docs/operations.md, "Package layout").
package: build
	cd $(BUILD) && cpack -G DEB

# libFuzzer targets (tests/fuzz), run side by side for FUZZ_SECONDS each from their seed corpus;
# new inputs and crashing ones stay in $(FUZZ_BUILD). They are built in the sanitizer build's
# tree (clang, ASan/UBSan, every library with the fuzzer's coverage hooks).
FUZZ_BUILD   ?= $(ASAN_BUILD)
FUZZ_SECONDS ?= 30
FUZZ_TARGETS  = fuzz_rpc_decoder fuzz_msgpack_value fuzz_payload
fuzz: DEB_PACKAGES += clang libclang-rt-dev

fuzz: deps $(ASAN_BUILD)/CMakeCache.txt
	cmake --build $(FUZZ_BUILD) -j $(JOBS) --target fuzz_targets
	@mkdir -p $(FUZZ_BUILD)/artifacts; pids=; \
	for t in $(FUZZ_TARGETS); do \
	  mkdir -p $(FUZZ_BUILD)/corpus/$$t; \
	  dict=$$( [ -f tests/fuzz/$$t.dict ] && echo -dict=tests/fuzz/$$t.dict || true ); \
	  $(FUZZ_BUILD)/$$t -max_total_time=$(FUZZ_SECONDS) -print_final_stats=1 -timeout=10 $$dict \
	    -artifact_prefix=$(FUZZ_BUILD)/artifacts/$$t- $(FUZZ_BUILD)/corpus/$$t tests/fuzz/corpus/$$t \
	    > $(FUZZ_BUILD)/$$t.log 2>&1 & pids="$$pids $$!"; \
	done; \
	failed=0; for p in $$pids; do wait $$p || failed=1; done; \
	for t in $(FUZZ_TARGETS); do \
	  runs=$$(sed -n 's/^stat::number_of_executed_units: *//p' $(FUZZ_BUILD)/$$t.log); \
	  if grep -q '^==[0-9]*==ERROR\|^SUMMARY: \|deadly signal' $(FUZZ_BUILD)/$$t.log || [ -z "$$runs" ]; then \
	    tail -n 60 $(FUZZ_BUILD)/$$t.log; echo "$$t: FAILED (inputs in $(FUZZ_BUILD)/artifacts)"; failed=1; \
	  else echo "$$t: $$runs executions in $(FUZZ_SECONDS) s, no crash"; fi; \
	done; exit $$failed

format:
	clang-format -i $$(git ls-files '*.cpp' '*.h')

clean:
	rm -rf $(BUILD) $(ASAN_BUILD)
