kytdemo --stage -- node "$EXAMPLES/node/report_dbus.js"
