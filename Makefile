# Two commands matter: `make run` and `make test`. Both install what is missing first.
BUILD      ?= build
ASAN_BUILD ?= build-asan
JOBS       ?= $(shell nproc)
DEB_PACKAGES = cmake g++ make pkg-config libasio-dev libmsgpack-cxx-dev nlohmann-json3-dev \
               libsqlite3-dev sqlite3 systemtap-sdt-dev libgtest-dev libgmock-dev googletest \
               libcurl4-openssl-dev python3-msgpack help2man dpkg-dev

.PHONY: deps build run test test-asan clean format install package

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

test: build
	cd $(BUILD) && ctest --output-on-failure -j $(JOBS)

$(ASAN_BUILD)/CMakeCache.txt:
	cmake -S . -B $(ASAN_BUILD) -DCMAKE_BUILD_TYPE=Debug -DSXR_SANITIZE=ON

test-asan: deps $(ASAN_BUILD)/CMakeCache.txt
	cmake --build $(ASAN_BUILD) -j $(JOBS)
	cd $(ASAN_BUILD) && ASAN_OPTIONS=detect_leaks=1 UBSAN_OPTIONS=print_stacktrace=1 ctest --output-on-failure -j $(JOBS)

# Installs under $(PREFIX) (or $(DESTDIR)$(PREFIX)); see README "Install as a service".
PREFIX ?= /usr/local
install: build
	DESTDIR=$(DESTDIR) cmake --install $(BUILD) --prefix $(PREFIX)

# The Debian package, $(BUILD)/sxreportingd_<version>_<arch>.deb.
package: build
	cd $(BUILD) && cpack -G DEB

format:
	clang-format -i $$(git ls-files '*.cpp' '*.h')

clean:
	rm -rf $(BUILD) $(ASAN_BUILD)
