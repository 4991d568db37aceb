rustc --edition 2021 "$EXAMPLES/rust/report.rs" $(pkg-config --libs kytreporting) -o hello
kytdemo --stage -- ./hello
