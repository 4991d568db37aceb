cat > hello.py <<'END'
import kytreporting as kyt

with kyt.Session(client_type=20, client="hello", service="demo") as session:
    session.send(10, 1, step=1)
END
kytdemo --stage -- /usr/bin/python3 hello.py
