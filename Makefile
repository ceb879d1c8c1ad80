# The one front door. Every target installs what it lacks, so each works on a fresh machine.
SHELL := /bin/bash
.DEFAULT_GOAL := help
JOBS ?= $(shell nproc)

help: ## list the targets
	@awk -F':.*## ' '/^[a-z-]+:.*## / { printf "  make %-10s %s\n", $$1, $$2 }' $(MAKEFILE_LIST)

bootstrap: ## install the packages that building and testing need (Debian 12)
	@tools/bootstrap.sh build

build: bootstrap ## build everything (release)
	cmake --preset release
	cmake --build --preset release -j $(JOBS)

demo: build ## run the daemon on the sample applications and show the whole story
	samples/demo.sh build/release

test: build ## run every test
	ctest --preset release

check: ## what every change must pass: format, warnings, clang-tidy, tests, tests under the sanitizers
	@tools/bootstrap.sh check
	tools/check.sh

bench: build ## measure, beside references measured in the same run
	bench/run.sh build/release

fuzz: ## run each fuzzer for FUZZ_SECONDS (60) seconds
	@tools/bootstrap.sh check
	cmake --preset fuzz
	cmake --build --preset fuzz -j $(JOBS)
	tools/fuzz.sh build/fuzz/fuzz $(or $(FUZZ_SECONDS),60)

format: ## format the sources in place
	@tools/bootstrap.sh check
	tools/format.sh

install: build ## install below DESTDIR (needs privileges for /)
	cmake --install build/release --prefix /usr

package: build ## make a Debian package in build/release
	cd build/release && cpack -G DEB

clean: ## remove what was built
	rm -rf build

.PHONY: help bootstrap build demo test check bench fuzz format install package clean
