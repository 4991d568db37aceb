GO111MODULE=off GOPATH=/usr/share/gocode go build -o hello "$EXAMPLES/go/report_dbus.go"
kytdemo --stage -- ./hello
