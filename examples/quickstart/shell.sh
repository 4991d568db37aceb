cat > hello.jsonl <<'END'
{"category":10,"type":1,"payload":{"step":1}}
END
kytdemo --stage -- sh -c 'kytctl send --client-type 20 --require-user-info \
  --user-info "{\"ClientName\":\"hello\",\"ServiceName\":\"demo\"}" --stdin < hello.jsonl'
