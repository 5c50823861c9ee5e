# The doors of the README. Each installs what is missing (Debian, Ubuntu), configures, builds and runs.

PREFIX ?= /usr/local
release := build/release
STORM_SECONDS ?= 3600
SEED ?= 1
MEMBERS ?= 10

.PHONY: all cluster demo test storm bench interface install package help

all: ## build everything, optimised
	@scripts/build.sh release

demo: ## processes vote, talk and die, one timeline of what each saw; daemons under their master; three hosts
	@scripts/dependencies.sh cluster || true # without them the act on three hosts is skipped
	@scripts/build.sh product
	@$(release)/bin/demo

test: ## the whole suite: release build, address+undefined sanitizers, thread sanitizer
	@scripts/test.sh release asan tsan

cluster: ## a shell on the first of three hosts on this machine, to play with; needs no root
	@scripts/dependencies.sh cluster
	@scripts/build.sh product
	@scripts/cluster.sh run 3 $(CURDIR)/scripts/cluster_shell.sh $(CURDIR)/$(release)/bin

storm: ## processes killed and stopped at random, what they saw compared; STORM_SECONDS=3600 SEED=1 MEMBERS=10
	@scripts/build.sh release storm
	@$(release)/bin/tests/storm --seconds $(STORM_SECONDS) --seed $(SEED) --members $(MEMBERS)

bench: ## figures against their bounds; tables here, JSON in build/release/bench
	@scripts/build.sh release
	@scripts/bench.sh $(release)

interface: ## save the library's interface anew, against which a test holds it; after a change that should be
	@scripts/dependencies.sh test
	@scripts/build.sh release update_interface

install: ## libraries, programs, headers, CMake package and .pc under PREFIX (default /usr/local)
	@scripts/build.sh product
	@scripts/install.sh $(release) '$(PREFIX)'

package: ## a .deb in build/release
	@scripts/dependencies.sh package
	@scripts/build.sh product
	@cd $(release) && cpack -G DEB

help: ## this list
	@sed -n 's/^\([a-z]*\):.*## /  make \1\t/p' $(firstword $(MAKEFILE_LIST)) | expand -t 18
