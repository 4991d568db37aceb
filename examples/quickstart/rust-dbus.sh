cp -r "$EXAMPLES/rust/dbus" dbus
(cd dbus && cargo build --quiet --offline --config debian.toml)
kytdemo --stage -- dbus/target/debug/report_dbus
