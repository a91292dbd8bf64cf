# tarvod: build, test and run. See README.md.
SHELL := /bin/bash
BUILD_TYPE ?= RelWithDebInfo
JOBS ?= $(shell nproc)
WERROR ?= $(if $(CI),ON,OFF)
CMAKE_FLAGS := -G Ninja -DCMAKE_BUILD_TYPE=$(BUILD_TYPE) -DTARVOD_WERROR=$(WERROR)

# Debian packages the build, the tests and `make run` need.
PACKAGES := build-essential cmake ninja-build pkg-config clang-format \
  libplist-dev libsystemd-dev libcurl4-openssl-dev \
  libgtest-dev libgmock-dev libbenchmark-dev \
  dbus-daemon systemd util-linux procps bsd-mailx python3 python3-aiosmtpd scdoc groff-base

.PHONY: all deps build build-asan build-tsan test test-unit test-asan test-tsan test-deb run bench \
  bench-e2e format clean install uninstall deb

all: build

deps:
	@missing=$$(for p in $(PACKAGES); do \
	  dpkg-query -W -f='$${Status}\n' $$p 2>/dev/null | grep -q 'install ok installed' || echo $$p; done); \
	if [ -n "$$missing" ]; then \
	  echo "Installing:" $$missing; \
	  if [ "$$(id -u)" = 0 ]; then SUDO=; else SUDO=sudo; fi; \
	  $$SUDO apt-get update -qq && \
	  DEBIAN_FRONTEND=noninteractive $$SUDO apt-get install -y -qq --no-install-recommends $$missing >/dev/null; \
	fi

build: deps
	cmake -S . -B build $(CMAKE_FLAGS) >/dev/null
	ninja -C build -j $(JOBS)

build-asan: deps
	cmake -S . -B build-asan $(CMAKE_FLAGS) -DTARVOD_SANITIZE=address -DTARVOD_BENCH=OFF >/dev/null
	ninja -C build-asan -j $(JOBS)

build-tsan: deps
	cmake -S . -B build-tsan $(CMAKE_FLAGS) -DTARVOD_SANITIZE=thread -DTARVOD_BENCH=OFF >/dev/null
	ninja -C build-tsan -j $(JOBS)

test-unit: build
	ctest --test-dir build --output-on-failure -j $(JOBS)

test-asan: build-asan
	ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
	  ctest --test-dir build-asan --output-on-failure -j $(JOBS)

# The threaded parts (queues, dispatch, listeners) under ThreadSanitizer.
test-tsan: build-tsan
	TSAN_OPTIONS=halt_on_error=1:second_deadlock_stack=1 \
	  ctest --test-dir build-tsan --output-on-failure -j $(JOBS) -L threaded

test: test-unit test-asan test-tsan test-deb

bench: build
	@for b in build/bench/*_bench; do [ -x "$$b" ] && "$$b"; done

# The event path end to end (bench/e2e_bench.cc) beside the socket floors and SEC, in one run;
# E2E_ARGS passes options (--events, --rate, --repeat, --only). Needs SEC; the profilers are
# for the profiles the benchmark's comment describes.
BENCH_PACKAGES := sec strace linux-perf
bench-e2e: build
	@$(MAKE) --no-print-directory deps PACKAGES="$(BENCH_PACKAGES)"
	./build/bench/bench_e2e $(E2E_ARGS)

# Starts tarvod in the foreground on the bundled example; everything it writes goes to run/.
run: build
	@mkdir -p run
	./build/src/daemon/tarvod -c examples/tarvod.plist -r examples/rules

# Fuzzing (fuzz/): each target built with clang, libFuzzer, ASan and UBSan in build-fuzz, then
# run for FUZZ_SECONDS over its committed seeds; inputs it finds go to build-fuzz/corpus/TARGET,
# crashes to build-fuzz/artifacts/. fuzz/TARGET.flags adds libFuzzer options for one target and
# fuzz/TARGET.dict is its dictionary of tokens.
FUZZ_SECONDS ?= 60
FUZZ_TARGETS := plist_xml plist_binary plist_text context criteria bsm_record event_packet \
  rules_file ssh_log keychain state_file dbus_notification
FUZZ_PACKAGES := clang libclang-rt-14-dev
.PHONY: fuzz
fuzz: deps
	@$(MAKE) --no-print-directory deps PACKAGES="$(FUZZ_PACKAGES)"
	CC=clang CXX=clang++ cmake -S . -B build-fuzz -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
	  -DTARVOD_FUZZ=ON -DTARVOD_BENCH=OFF >/dev/null
	ninja -C build-fuzz -j $(JOBS) $(FUZZ_TARGETS:%=%_fuzz)
	@mkdir -p build-fuzz/artifacts
	@for t in $(FUZZ_TARGETS); do \
	  echo "fuzzing $$t for $(FUZZ_SECONDS) s"; mkdir -p build-fuzz/corpus/$$t; \
	  ./build-fuzz/fuzz/$${t}_fuzz -max_total_time=$(FUZZ_SECONDS) -print_final_stats=1 \
	    -artifact_prefix=build-fuzz/artifacts/$$t- $$(cat fuzz/$$t.flags 2>/dev/null) \
	    $$(test -f fuzz/$$t.dict && echo -dict=fuzz/$$t.dict) \
	    build-fuzz/corpus/$$t fuzz/corpus/$$t || exit 1; \
	done

# Installs under DESTDIR$(PREFIX) (the unit and /etc below DESTDIR alone) through the build's
# CMake install rules; an existing /etc/tarvod.d/tarvod.plist is kept.
PREFIX ?= /usr
install: build
	DESTDIR=$(DESTDIR) cmake --install build --prefix $(PREFIX)

# Removes what the last install with the same DESTDIR wrote (build/install_manifest.txt), except
# the configuration and the rules below /etc/tarvod.d, which belong to the administrator.
uninstall:
	@test -f build/install_manifest.txt || { echo "nothing installed from build/"; exit 1; }
	@grep -v '^/etc/tarvod.d/' build/install_manifest.txt | while read -r f; do \
	  rm -fv "$(DESTDIR)$$f"; done

# The Debian package, built from a copy of this tree's files (committed and new, not ignored)
# so that dpkg-buildpackage writes its results into build-deb/ and nowhere beside the checkout;
# then lintian, which fails the target on any error.
DEB_PACKAGES := debhelper dpkg-dev fakeroot lintian
deb:
	@$(MAKE) --no-print-directory deps PACKAGES="$(DEB_PACKAGES)"
	rm -rf build-deb && mkdir -p build-deb/tarvod
	git ls-files -co --exclude-standard | while read -r f; do [ -e "$$f" ] && echo "$$f"; done | \
	  tar -cf - -T - | tar -xf - -C build-deb/tarvod
	cd build-deb/tarvod && DEB_BUILD_OPTIONS="nocheck parallel=$(JOBS)" dpkg-buildpackage -us -uc -b
	lintian --fail-on error build-deb/*.changes

test-deb: deb
	tests/package_test.sh build-deb

format:
	git ls-files '*.cc' '*.h' | xargs clang-format -i

clean:
	rm -rf build build-asan build-tsan build-deb build-fuzz run
