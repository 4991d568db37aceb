go build -o hello "$EXAMPLES/go/report.go"
kytdemo --stage -- ./hello
